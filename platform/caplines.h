// The lines of a capability file, as text: nothing here opens a file. A line keeps its line feed
// and may hold any bytes; zamoc.h says what is a key and what a value.
#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace caplines {

// Whether there is a line of that key; *pValue is then the value of the first, a part of Text.
bool FindKey(std::string_view Text, std::string_view Key, std::string_view* pValue);

// Fills the two "%s" of strFormat with key and value. Returns nothing when it has not exactly two,
// or when they do not make one line, closed by a line feed, of that key.
std::string FormatLine(const std::string& strFormat, const std::string& strKey,
                       const std::string& strValue);

struct Change {
  std::string strKey;
  std::string strNewLine;  // empty: the key is taken out
};

// Returns Text with changes of different keys made. The new line of a key replaces its first line,
// or is appended when it has none; all other lines of that key are dropped.
std::string ChangeLines(std::string_view Text, const std::vector<Change>& Changes);

}  // namespace caplines

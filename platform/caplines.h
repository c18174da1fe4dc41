// Finds and changes lines in the text of a capability file; opens no file. A line includes its line
// feed and may contain any bytes. zamoc.h defines key and value.
#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace caplines {

// Returns true if Text has a line of that key. *pValue is then the value of the first such line, as
// a part of Text.
bool FindKey(std::string_view Text, std::string_view Key, std::string_view* pValue);

// Replaces the first "%s" of strFormat with the key and the second with the value. Returns an empty
// string if strFormat does not have exactly two '%', both in "%s", or if the result is not one line
// of that key that ends in a line feed.
std::string FormatLine(const std::string& strFormat, const std::string& strKey,
                       const std::string& strValue);

struct Change {
  std::string strKey;
  std::string strNewLine;  // empty: remove the key
};

// Returns Text with the changes made; their keys must differ. The new line of a key replaces its
// first line, or is appended if the key has none. Repeated lines of a key are dropped, whether the
// key is set or removed.
std::string ChangeLines(std::string_view Text, const std::vector<Change>& Changes);

}  // namespace caplines

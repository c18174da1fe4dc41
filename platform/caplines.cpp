#include "caplines.h"

#include <algorithm>

namespace {

constexpr const char* BLANKS = " \t";

// Removes the first line, with its line feed, from *pText, which must not be empty, and returns it.
std::string_view TakeLine(std::string_view* pText) {
  const size_t Feed = pText->find('\n');
  const std::string_view Line = pText->substr(0, Feed == std::string_view::npos ? Feed : Feed + 1);
  pText->remove_prefix(Line.size());
  return Line;
}

std::string_view TrimBlanks(std::string_view Text) {
  const size_t First = Text.find_first_not_of(BLANKS);
  if (First == std::string_view::npos) {
    return "";
  }
  return Text.substr(First, Text.find_last_not_of(BLANKS) - First + 1);
}

// The key of a line; empty if it has none.
std::string_view KeyOf(std::string_view Line) {
  const size_t Equals = Line.find('=');
  if (Equals == std::string_view::npos || Line[0] == '#') {
    return "";
  }
  return TrimBlanks(Line.substr(0, Equals));
}

std::string_view ValueOf(std::string_view Line) {
  for (const char LineEnd : {'\n', '\r'}) {
    if (!Line.empty() && Line.back() == LineEnd) {
      Line.remove_suffix(1);
    }
  }
  std::string_view Value = TrimBlanks(Line.substr(Line.find('=') + 1));
  if (Value.size() >= 2 && Value.front() == '"' && Value.back() == '"') {
    Value = Value.substr(1, Value.size() - 2);
  }
  return Value;
}

}  // namespace

namespace caplines {

bool FindKey(std::string_view Text, std::string_view Key, std::string_view* pValue) {
  // Look only at lines that contain the key.
  size_t Pos = Key.empty() ? std::string_view::npos : Text.find(Key);
  while (Pos != std::string_view::npos) {
    Text.remove_prefix(Text.rfind('\n', Pos) + 1);
    const std::string_view Line = TakeLine(&Text);
    if (KeyOf(Line) == Key) {
      *pValue = ValueOf(Line);
      return true;
    }
    Pos = Text.find(Key);
  }
  return false;
}

std::string FormatLine(const std::string& strFormat, const std::string& strKey,
                       const std::string& strValue) {
  const size_t Key = strFormat.find("%s");
  const size_t Value = Key == std::string::npos ? Key : strFormat.find("%s", Key + 2);
  if (Value == std::string::npos || std::count(strFormat.begin(), strFormat.end(), '%') != 2) {
    return "";
  }
  std::string strLine = strFormat.substr(0, Key) + strKey +
                        strFormat.substr(Key + 2, Value - Key - 2) + strValue +
                        strFormat.substr(Value + 2);
  const bool blOneLine = strLine.find('\n') == strLine.size() - 1;
  return blOneLine && KeyOf(strLine) == strKey ? strLine : "";
}

std::string ChangeLines(std::string_view Text, const std::vector<Change>& Changes) {
  std::vector<bool> Found(Changes.size());
  std::string strNew;
  strNew.reserve(Text.size());
  while (!Text.empty()) {
    const std::string_view Line = TakeLine(&Text);
    const std::string_view Key = KeyOf(Line);
    size_t Idx = 0;
    while (Idx < Changes.size() && Changes[Idx].strKey != Key) {
      ++Idx;
    }
    if (Idx == Changes.size()) {
      strNew += Line;
    } else if (!Found[Idx]) {
      strNew += Changes[Idx].strNewLine;
      Found[Idx] = true;
    }
  }
  for (size_t Idx = 0; Idx < Changes.size(); ++Idx) {
    if (Found[Idx] || Changes[Idx].strNewLine.empty()) {
      continue;
    }
    if (!strNew.empty() && strNew.back() != '\n') {
      strNew += '\n';
    }
    strNew += Changes[Idx].strNewLine;
  }
  return strNew;
}

}  // namespace caplines

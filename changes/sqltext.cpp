#include "sqltext.h"

std::string Fill(const std::string& strPattern, const WordMap& Words) {
  std::string strText;
  size_t Pos = 0;
  for (size_t Open; (Open = strPattern.find('{', Pos)) != std::string::npos;) {
    const size_t Close = strPattern.find('}', Open);
    strText.append(strPattern, Pos, Open - Pos);
    strText += Words.at(strPattern.substr(Open + 1, Close - Open - 1));
    Pos = Close + 1;
  }
  return strText.append(strPattern, Pos);
}

std::string ForEach(const std::vector<std::string>& Names, const std::string& strPattern,
                    const std::string& strBetween) {
  std::string strText;
  for (size_t Idx = 0; Idx < Names.size(); ++Idx) {
    strText += Idx == 0 ? "" : strBetween;
    strText += Fill(strPattern, {{"name", Quoted(Names[Idx])}, {"i", std::to_string(Idx)}});
  }
  return strText;
}

std::string Quoted(const std::string& strName) {
  std::string strQuoted = "\"";
  for (const char Char : strName) {
    strQuoted.append(Char == '"' ? 2 : 1, Char);
  }
  return strQuoted + '"';
}

std::string SameValue(const std::string& strA, const std::string& strB) {
  return strA + " IS " + strB + " COLLATE BINARY AND same_type(" + strA + ", " + strB + ")";
}

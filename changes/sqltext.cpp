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
                    const std::string& strBetween, WordMap Words) {
  std::string strText;
  for (size_t Idx = 0; Idx < Names.size(); ++Idx) {
    Words["name"] = Quoted(Names[Idx]);
    Words["text"] = Literal(Names[Idx]);
    Words["i"] = std::to_string(Idx);
    strText += (Idx == 0 ? "" : strBetween) + Fill(strPattern, Words);
  }
  return strText;
}

// Puts a name between quotes, and doubles those in it.
static std::string InQuotes(char Quote, const std::string& strName) {
  std::string strQuoted(1, Quote);
  for (const char Char : strName) {
    strQuoted.append(Char == Quote ? 2 : 1, Char);
  }
  return strQuoted + Quote;
}

std::string Quoted(const std::string& strName) { return InQuotes('"', strName); }

std::string Literal(const std::string& strName) { return InQuotes('\'', strName); }

std::string SameValue(const std::string& strA, const std::string& strB) {
  return strA + " IS " + strB + " COLLATE BINARY AND same_type(" + strA + ", " + strB + ")";
}

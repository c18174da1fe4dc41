// The names of an enumeration's values.
#pragma once

#include <map>

// Holds the name of every named value of T, a string literal each. A constructor that fills it is
// defined for each enumeration that has names, beside the enumeration.
template <typename T>
class KiEnum2StrMap {
 public:
  KiEnum2StrMap();

  // "unknown" for a value without a name. The text lives as long as the process.
  const char* operator[](T Key) const {
    const auto It = m_szMap.find(Key);
    return It == m_szMap.end() ? "unknown" : It->second;
  }

 private:
  std::map<T, const char*> m_szMap;
};

// The name of Enum, or "unknown". The text lives as long as the process, and the caller does not
// free it. Any thread may call it, until the process's static objects are destroyed at its exit.
template <typename T>
const char* Enum2String(T Enum) {
  static const KiEnum2StrMap<T> Map;
  return Map[Enum];
}

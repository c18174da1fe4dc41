// The names of an enumeration's values.
#pragma once

#include <map>

// Maps the values of T to their names, which are string literals. Each enumeration with names has a
// specialized constructor, declared next to the enumeration, that fills the map.
template <typename T>
class KiEnum2StrMap {
 public:
  KiEnum2StrMap();

  // The name of Key, or "unknown" if it has none. The text lives as long as the process.
  const char* operator[](T Key) const {
    const auto It = m_szMap.find(Key);
    return It == m_szMap.end() ? "unknown" : It->second;
  }

 private:
  std::map<T, const char*> m_szMap;
};

// The name of Enum, or "unknown". The text lives as long as the process; the caller must not free
// it. Any thread may call it at any time, even while the process exits.
template <typename T>
const char* Enum2String(T Enum) {
  // Never destroyed: the destructors of global objects may log. Not called Map: programs built with
  // version 1.0.0 have an object of that name, and the shared library would use it as a pointer.
  static const KiEnum2StrMap<T>* const pMap = new KiEnum2StrMap<T>;
  return (*pMap)[Enum];
}

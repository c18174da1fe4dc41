// Preloaded: each connection to a database has synchronous = NORMAL.

#include <dlfcn.h>
#include <sqlite3.h>

extern "C" int sqlite3_open_v2(const char* szFile, sqlite3** ppDb, int Flags, const char* szVfs) {
  using OpenFunc = decltype(&sqlite3_open_v2);
  const auto pOpen = reinterpret_cast<OpenFunc>(dlsym(RTLD_NEXT, "sqlite3_open_v2"));
  const int Err = pOpen(szFile, ppDb, Flags, szVfs);
  sqlite3_exec(*ppDb, "PRAGMA synchronous = NORMAL", nullptr, nullptr, nullptr);
  return Err;
}

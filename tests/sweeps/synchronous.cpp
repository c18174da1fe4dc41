// Preloaded: each connection to a database has the synchronous setting that SYNCHRONOUS names.

#include <dlfcn.h>
#include <sqlite3.h>

#include <cstdlib>
#include <string>

extern "C" int sqlite3_open_v2(const char* szFile, sqlite3** ppDb, int Flags, const char* szVfs) {
  using OpenFunc = decltype(&sqlite3_open_v2);
  static const auto pOpen = reinterpret_cast<OpenFunc>(dlsym(RTLD_NEXT, "sqlite3_open_v2"));
  const int Err = pOpen(szFile, ppDb, Flags, szVfs);
  const std::string strPragma = std::string("PRAGMA synchronous = ") + getenv("SYNCHRONOUS");
  sqlite3_exec(*ppDb, strPragma.c_str(), nullptr, nullptr, nullptr);
  return Err;
}

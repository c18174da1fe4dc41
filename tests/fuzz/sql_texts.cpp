// SQL texts: a transaction that fails changes nothing, and each row of a result can be had.

#include <sqlite3.h>

#include <regex>

#include "check.h"
#include "zamodb.h"

// No text reaches beyond its database or runs for ever.
static int Guard(sqlite3* pDb, char** /*pszError*/, const sqlite3_api_routines* /*pApi*/) {
  const auto Authorize = [](void*, int Action, auto, auto, auto, auto) -> int {
    return Action == SQLITE_PRAGMA || Action == SQLITE_FUNCTION ? SQLITE_DENY : SQLITE_OK;
  };
  sqlite3_limit(pDb, SQLITE_LIMIT_ATTACHED, 0);
  sqlite3_limit(pDb, SQLITE_LIMIT_LENGTH, 100000);
  const auto Stop = [](void*) { return 1; };
  sqlite3_progress_handler(pDb, 20000, Stop, nullptr);
  return sqlite3_set_authorizer(pDb, Authorize, nullptr);
}

extern "C" int LLVMFuzzerInitialize(int* /*pArgc*/, char*** /*pArgv*/) {
  return sqlite3_auto_extension(reinterpret_cast<void (*)()>(Guard));
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* pData, size_t Size) {
  static const std::regex End("commit|end|release|rollback", std::regex::icase);
  const std::string strText(reinterpret_cast<const char*>(pData), Size);
  DBResult* pResult = nullptr;
  DBRow Row = 0;
  WriteFile("");
  DBConnect* pConn = ZAMODBConnect(nullptr, nullptr, nullptr, FILE_NAME);
  ZAMODBExecute(pConn, "CREATE TABLE t (n PRIMARY KEY); INSERT INTO t VALUES (1)", nullptr);
  const std::string strBefore = ReadFile();
  const int Ret = ZAMODBExecute(pConn, ("BEGIN;" + strText + ";COMMIT").c_str(), &pResult);
  ZAMODBClose(pConn);
  CHECK(Ret == 0 || ReadFile() == strBefore || std::regex_search(strText, End));
  for (unsigned int Left = ZAMODBNumRows(pResult); Left > 0; --Left) {
    CHECK(ZAMODBFetchRow(pResult, &Row) == 0);
    ZAMODBFetchField(pResult, Row, "n");
  }
  CHECK(ZAMODBFetchRow(pResult, &Row) == -1);
  ZAMODBFreeResult(pResult);
  return 0;
}

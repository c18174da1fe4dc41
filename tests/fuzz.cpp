// A fuzzer: lets FUZZ, a function of inputs_test.cpp, take what libFuzzer thinks of.

#include <fuzzer/FuzzedDataProvider.h>
#include <sqlite3.h>

#include <cstring>

#include "rig.h"

void FUZZ(const string& strFirst, const string& strSecond, const string& strThird);

// No text reaches beyond its database, runs for ever or depends on the time or on chance.
static int Guard(sqlite3* pDb, char** /*pszError*/, const sqlite3_api_routines* /*pApi*/) {
  const auto Denied = [](auto, int Action, auto, const char* szName, auto, auto) -> int {
    return Action == SQLITE_ATTACH || Action == SQLITE_PRAGMA || Action == SQLITE_CREATE_VTABLE ||
           (Action == SQLITE_FUNCTION && strstr("hex group_concat", szName) == nullptr);
  };
  sqlite3_limit(pDb, SQLITE_LIMIT_LENGTH, 100000);
  sqlite3_progress_handler(
      pDb, 20000, [](void*) { return 1; }, nullptr);
  return sqlite3_set_authorizer(pDb, Denied, nullptr);
}

extern "C" int LLVMFuzzerInitialize(int* /*pArgc*/, char*** /*pArgv*/) {
  ::testing::GTEST_FLAG(break_on_failure) = true;
  EXPECT_NE(getenv("TESSEL_PRIVATE_VAR"), nullptr);  // the paths are the appliance's own
  fs::create_directories(CAP_DIR);
  return sqlite3_auto_extension(reinterpret_cast<void (*)()>(Guard));
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* pData, size_t Size) {
  FuzzedDataProvider Input(pData, Size);
  const string strFirst = Input.ConsumeRandomLengthString(9);
  const string strSecond = Input.ConsumeRandomLengthString(9);
  FUZZ(strFirst, strSecond, Input.ConsumeRemainingBytesAsString());
  return 0;
}

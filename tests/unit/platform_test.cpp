// Capability files, the database layer, and the executor on it.

#include <fcntl.h>

#include <chrono>
#include <future>

#include "kidb.h"
#include "kiflock.h"
#include "rig.h"
#include "zamoc.h"
#include "zamodb.h"

namespace {

using namespace std::string_literals;

constexpr const char* FILE_NAME = "/var/services/camveld/file";
constexpr const char* LEFT_BEHIND = "/var/services/camveld/.zamoc.tmp";

class CapabilityFile : public PrivateVar {};
class Database : public PrivateVar {};

// The length of the value of k, and as much of it as a small buffer holds.
std::string Get(const char* szFile) {
  char szValue[8] = "old";
  const int Len = ZAMOCFileGetKeyValue(szFile, "k", szValue, sizeof(szValue), 0);
  return std::to_string(Len) + " " + szValue;
}

int Set(const char* szFile, const char* szValue) {
  return ZAMOCFileSetKeyValue(szFile, "k", szValue, "%s= %s\n");
}

TEST_F(CapabilityFile, LinesAreReadAndChanged) {
  const std::string strOthers = "#k=1\nK=2\nkk=3\nx=k\n=k\nk\n\r\n \n";
  const struct {
    std::string strBefore;
    std::string strGot;
    std::string strAfter;  // k was set
  } rgCase[] = {
      {"", "0 ", "k= new\n"},
      {"a=1", "0 ", "a=1\nk= new\n"},
      {strOthers, "0 ", strOthers + "k= new\n"},
      {"a=1\nk=2\nb=3\nk=4\n\n k\t=5", "1 2", "a=1\nk= new\nb=3\n\n"},
      {" k\t=\t v= w \t\r\nb=3", "4 v= w", "k= new\nb=3"},
      {"k = \"a \"\r\n", "2 a ", "k= new\n"},
      {"k=\"\"a\"\"", "3 \"a\"", "k= new\n"},
      {"k=\"\n", "1 \"", "k= new\n"},
      {"a=\0\nk=12345678\n"s, "8 1234567", "a=\0\nk= new\n"s},
  };
  for (const auto& Case : rgCase) {
    WriteFile(FILE_NAME, Case.strBefore);
    EXPECT_EQ(Get(FILE_NAME), Case.strGot) << Case.strBefore;
    EXPECT_EQ(Set(FILE_NAME, "new"), 0);
    EXPECT_EQ(ReadFile(FILE_NAME), Case.strAfter);
  }
}

TEST_F(CapabilityFile, KeysChangeTogetherOrNotAtAll) {
  const ZAMOCKeyChange rgChange[] = {
      {"a", "x", "%s=\"%s\"\n"}, {"b", nullptr, nullptr}, {"c", "", "%s=%s\n"}};
  const ZAMOCKeyChange rgBad[] = {{"a", "y", "%s=%s\n"}, {"b", "y", "%s=%s"}};
  WriteFile(FILE_NAME, "b=1\na=2\nd=3\na=4\nb=5\n");
  EXPECT_EQ(ZAMOCFileChangeKeys(FILE_NAME, rgChange, 3), 0);
  EXPECT_EQ(ZAMOCFileChangeKeys(FILE_NAME, rgBad, 2), -1);
  EXPECT_EQ(ReadFile(FILE_NAME), "a=\"x\"\nd=3\nc=\n");
  EXPECT_EQ(ZAMOCFileRemoveKey(FILE_NAME, "a"), 1);
  EXPECT_EQ(ReadFile(FILE_NAME), "d=3\nc=\n");
}

TEST_F(CapabilityFile, WhatIsNotOneLineOfTheKeyIsRefused) {
  WriteFile(FILE_NAME, "k=1\n");
  for (const char* szFormat : {"%s=\n", "%s=%d\n", "%s=%s%n\n", "%s=%s", "%s %s\n", "#%s=%s\n"}) {
    EXPECT_EQ(ZAMOCFileSetKeyValue(FILE_NAME, "k", "v", szFormat), -1) << szFormat;
  }
  EXPECT_EQ(ZAMOCFileSetKeyValue(FILE_NAME, "", "v", "%s=%s\n"), -1);
  EXPECT_EQ(Set(FILE_NAME, "v\nx=1"), -1);
  EXPECT_EQ(ReadFile(FILE_NAME), "k=1\n");
}

TEST_F(CapabilityFile, ReadingIsOfOneMomentInItsThread) {
  WriteFile(FILE_NAME, "k=1");
  const ZAMOCReading Reading(FILE_NAME);
  WriteFile(FILE_NAME, "k=22");
  EXPECT_EQ(Get(FILE_NAME), "1 1");
  EXPECT_EQ(std::async(std::launch::async, Get, FILE_NAME).get(), "2 22");
}

TEST_F(CapabilityFile, OnlyRegularFilesAreRead) {
  mkfifo("/var/fifo", 0600);
  WriteFile(LEFT_BEHIND, "k=1\n");
  for (const char* szFile : {"/var/none", "/var/fifo", "/dev/null", LEFT_BEHIND}) {
    EXPECT_EQ(Get(szFile), "-1 ") << szFile;
    EXPECT_EQ(Set(szFile, "2"), -1) << szFile;
    EXPECT_EQ(ZAMOCFileRemoveKey(szFile, "k"), -1) << szFile;
  }
}

TEST_F(CapabilityFile, ReplacementIsWholeAndNotWithoutNeed) {
  const char* const szOld = "/var/old";  // a second name of the old file
  const char* const szLink = "/var/link";
  WriteFile(FILE_NAME, "k=1\n");
  WriteFile(LEFT_BEHIND, "by a killed process");
  static_cast<void>(!chown(FILE_NAME, 12, 34));  // an ordinary user may not
  chmod(FILE_NAME, 06741);
  fs::create_hard_link(FILE_NAME, szOld);
  fs::create_symlink(FILE_NAME, szLink);
  EXPECT_EQ(ZAMOCFileRemoveKey(szLink, "absent"), 0);
  EXPECT_EQ(fs::hard_link_count(szOld), 2U);
  EXPECT_EQ(Set(szLink, "2"), 0);
  EXPECT_EQ(ReadFile(szOld), "k=1\n");
  EXPECT_EQ(ReadFile(FILE_NAME), "k= 2\n");
  EXPECT_TRUE(fs::is_symlink(szLink));
  EXPECT_EQ(Rights(FILE_NAME), Rights(szOld));
}

TEST_F(CapabilityFile, ChangesInADirectoryTakeTurns) {
  WriteFile(FILE_NAME, "");
  const int Dir = open("/var/services/camveld", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  ASSERT_EQ(KiFlock::Lock(Dir, 0, true), 0);
  std::future<int> Waiting = std::async(std::launch::async, Set, FILE_NAME, "2");
  EXPECT_EQ(Waiting.wait_for(std::chrono::milliseconds(300)), std::future_status::timeout);
  close(Dir);
  EXPECT_EQ(Waiting.get(), 0);
}

TEST_F(Database, OnlyWritableDatabasesAreOpened) {
  const char* const szDir = "/var/packages/Camveld/target";
  mount(szDir, szDir, nullptr, MS_BIND, nullptr);
  mount(nullptr, szDir, nullptr, MS_REMOUNT | MS_BIND | MS_RDONLY, nullptr);
  for (const char* szName : {SYSTEM_DB, szDir, ":memory:", ""}) {
    EXPECT_EQ(ZAMODBConnect(nullptr, nullptr, nullptr, szName), nullptr) << szName;
  }
  umount2(szDir, MNT_DETACH);
}

// Runs a text. Returns the number of rows and the values of column n in them, or the reason.
std::string Result(DBConnect* pConn, const char* szText) {
  DBResult* pResult = nullptr;
  DBRow Row = 0;
  ::testing::internal::CaptureStderr();
  const int Ret = ZAMODBExecute(pConn, szText, &pResult);
  std::string strResult = ::testing::internal::GetCapturedStderr();
  if (Ret == 0) {
    strResult += std::to_string(ZAMODBNumRows(pResult));
  }
  while (ZAMODBFetchRow(pResult, &Row) == 0) {
    const char* szField = ZAMODBFetchField(pResult, Row, "N");
    strResult.append(" ").append(szField == nullptr ? "null" : szField);
  }
  ZAMODBFreeResult(pResult);
  return strResult;
}

TEST_F(Database, TextsRunToTheirFirstFailure) {
  const std::string strStart = "syslog: zamodb: [" + std::string(SYSTEM_DB) + "]: ";
  DBConnect* pConn = ZAMODBConnect(nullptr, nullptr, nullptr, SYSTEM_DB);
  EXPECT_EQ(Result(pConn, "CREATE TABLE t (n CHECK (n < 9));;; -- x\n ; INSERT INTO t VALUES (1)"),
            "0");
  EXPECT_EQ(Result(pConn, "SELECT 5 n; INSERT INTO t VALUES (3); SELECT 2 m, n FROM t"), "2 1 3");
  EXPECT_EQ(Result(pConn, "SELECT '' n UNION ALL SELECT NULL"), "2  null");
  EXPECT_EQ(Result(pConn, "SELECT 5 n; SELECT 1 n WHERE 0"), "0");
  EXPECT_EQ(Result(pConn, "INSERT INTO t VALUES (9); DELETE FROM t"),
            strStart + "CHECK constraint failed: n < 9 (extended code 275)\n");
  EXPECT_EQ(Result(pConn, "BEGIN; DELETE FROM t; SELECT x; COMMIT"),
            strStart + "no such column: x (extended code 1)\n");
  EXPECT_EQ(Result(pConn, "BEGIN; SELECT n FROM t; COMMIT"), "2 1 3");
  EXPECT_EQ(Result(pConn, "BEGIN; DELETE FROM t"),
            strStart + "the text leaves a transaction open (extended code 0)\n");
  EXPECT_EQ(Result(pConn, "SELECT n FROM t"), "2 1 3");
  ZAMODBClose(pConn);
}

TEST_F(Database, ExecutorMakesATransactionOfEachText) {
  using namespace KiDB;
  const char* const szQuery = "SELECT n || 'TRUEfalseFALSEtruetrueTrue' n FROM t";
  DBResult* pResult = nullptr;
  WriteFile("/var/services/camveld/recording.db", "");
  EXPECT_EQ(Execute(DBI_RECORDING, "CREATE TABLE r (n)", nullptr, true), 0);
  EXPECT_EQ(Execute(DBI_SYSTEM, "CREATE TABLE t (n); INSERT INTO t VALUES (1)", nullptr, true), 0);
  EXPECT_EQ(Execute(DBI_SYSTEM, "DELETE FROM t; DELETE FROM r", nullptr, true), -1);
  EXPECT_EQ(Execute(DBI_SYSTEM, szQuery, &pResult, true), 0);
  EXPECT_STREQ(ZAMODBFetchField(pResult, 0, "n"), "110011True");
  KiDBFreeResult(pResult);
  EXPECT_EQ(Execute(DBI_SYSTEM, "SELECT 'true'", nullptr, false), 0);
  EXPECT_EQ(Execute(DBI_CNT, "SELECT 1", nullptr, false), -1);
  EXPECT_EQ(LogText(),
            "kidb.cpp:Execute(): Failed to execute db[0] cmd: "
            "BEGIN;DELETE FROM t; DELETE FROM r;COMMIT;.\n"
            "kidb.cpp:ReplaceBoolForSqlite(): Got sql cmd with bool replaced: "
            "SELECT n || '10011True' n FROM t\n"
            "kidb.cpp:Execute(): Failed to connect to db[2, ].\n");
  for (int Time = 0; Time < 50; ++Time) {  // more often than there are descriptors
    ASSERT_EQ(Execute(DBI_SYSTEM, "SELECT 1", nullptr, false), 0);
  }
}

}  // namespace

// The database layer, and the executor on it.

#include "zamodb.h"

#include <sys/resource.h>

#include "kidb.h"
#include "rig.h"

namespace {

class Database : public PrivateVar {
 protected:
  void SetUp() override {
    PrivateVar::SetUp();
    WriteFile(SYSTEM_DB, "");
  }
};

// The rows of column n, each closed by ';', with - for a null; "none" without a result.
std::string TakeRows(DBResult* pResult) {
  std::string strRows = pResult == nullptr ? "none" : "";
  DBRow Row = 0;
  while (ZAMODBFetchRow(pResult, &Row) == 0) {
    const char* szField = ZAMODBFetchField(pResult, Row, "N");
    strRows.append(szField == nullptr ? "-" : szField).append(";");
  }
  ZAMODBFreeResult(pResult);
  return strRows;
}

TEST_F(Database, OnlyWritableDatabasesAreOpened) {
  const char* const szDir = "/var/packages/Camveld/target";
  mount(szDir, szDir, nullptr, MS_BIND, nullptr);
  mount(nullptr, szDir, nullptr, MS_REMOUNT | MS_BIND | MS_RDONLY, nullptr);
  EXPECT_EQ(ZAMODBConnect(nullptr, nullptr, nullptr, SYSTEM_DB), nullptr);
  umount2(szDir, MNT_DETACH);
  EXPECT_EQ(ZAMODBConnect(nullptr, nullptr, nullptr, szDir), nullptr);
  EXPECT_EQ(ZAMODBConnect(nullptr, nullptr, nullptr, ":memory:"), nullptr);
}

TEST_F(Database, TextsRunToTheirFirstFailure) {
  const struct {
    const char* szText;
    const char* szResult;
    const char* szReason;  // in syslog
  } rgCase[] = {
      {"CREATE TABLE t (n CHECK (n <> 13));;; -- nothing\n ; INSERT INTO t VALUES (1)", "none", ""},
      {"SELECT 5 n; INSERT INTO t VALUES (2); SELECT n FROM t UNION ALL SELECT NULL;", "1;2;-;",
       ""},
      {"SELECT 5 n; SELECT 1 n WHERE 0", "", ""},
      {"INSERT INTO t VALUES (3); INSERT INTO t VALUES (13); DELETE FROM t", "none",
       "CHECK constraint failed: n <> 13 (extended code 275)"},
      {"BEGIN; DELETE FROM t; SELECT x; COMMIT", "none", "no such column: x (extended code 1)"},
      {"BEGIN; SELECT n FROM t; COMMIT", "1;2;3;", ""},
      {"BEGIN; DELETE FROM t", "none", "the text leaves a transaction open (extended code 0)"},
      {"SELECT n FROM t", "1;2;3;", ""},
  };
  const SyslogSocket Syslog;
  DBConnect* pConn = ZAMODBConnect(nullptr, nullptr, nullptr, SYSTEM_DB);
  for (const auto& Case : rgCase) {
    DBResult* pResult = nullptr;
    const bool blFails = *Case.szReason != '\0';
    EXPECT_EQ(ZAMODBExecute(pConn, Case.szText, &pResult), blFails ? -1 : 0) << Case.szText;
    EXPECT_EQ(TakeRows(pResult), Case.szResult) << Case.szText;
    const std::string strStart = blFails ? "zamodb: [" + std::string(SYSTEM_DB) + "]: " : "";
    EXPECT_EQ(Syslog.Take(), strStart + Case.szReason);
  }
  ZAMODBClose(pConn);
}

TEST_F(Database, ResultAnswersOnlyForWhatItHas) {
  DBResult* pResult = nullptr;
  DBConnect* pConn = ZAMODBConnect(nullptr, nullptr, nullptr, SYSTEM_DB);
  ASSERT_EQ(ZAMODBExecute(pConn, "SELECT 1 n, 'a''b' m UNION ALL SELECT 2.5, ''", &pResult), 0);
  ZAMODBClose(pConn);
  EXPECT_EQ(ZAMODBNumRows(pResult), 2U);
  EXPECT_STREQ(ZAMODBFetchField(pResult, 0, "M"), "a'b");
  EXPECT_STREQ(ZAMODBFetchField(pResult, 1, "m"), "");
  EXPECT_EQ(ZAMODBFetchField(pResult, 0, "none"), nullptr);
  EXPECT_EQ(ZAMODBFetchField(pResult, 2, "n"), nullptr);
  EXPECT_EQ(TakeRows(pResult), "1;2.5;");
  EXPECT_EQ(ZAMODBNumRows(nullptr), 0U);
  EXPECT_EQ(ZAMODBExecute(nullptr, "", nullptr), -1);
  ZAMODBClose(nullptr);
}

TEST_F(Database, ExecutorMakesATransactionOfEachText) {
  DBResult* pResult = nullptr;
  const auto Execute = [&pResult](KiDB::DB_INSTANCE Instance, const char* szText) {
    return KiDB::Execute(Instance, szText, &pResult, true);
  };
  WriteFile("/var/services/camveld/recording.db", "");
  EXPECT_EQ(Execute(KiDB::DBI_RECORDING, "CREATE TABLE r (n)"), 0);
  EXPECT_EQ(Execute(KiDB::DBI_SYSTEM, "CREATE TABLE t (n); INSERT INTO t VALUES (1)"), 0);
  EXPECT_EQ(Execute(KiDB::DBI_SYSTEM, "DELETE FROM t; DELETE FROM r"), -1);
  EXPECT_EQ(pResult, nullptr);
  const char* const szQuery = "SELECT n || 'TRUEfalseFALSEtruetrueTrue' n FROM t";
  EXPECT_EQ(Execute(KiDB::DBI_SYSTEM, szQuery), 0);
  EXPECT_EQ(TakeRows(pResult), "110011True;");
  EXPECT_EQ(KiDB::Execute(KiDB::DBI_SYSTEM, "SELECT 'true'", nullptr, false), 0);
  EXPECT_EQ(Execute(KiDB::DBI_CNT, "SELECT 1"), -1);
  const std::string strFailed = "kidb.cpp:Execute(): Failed to ";
  EXPECT_EQ(LogLines(),
            (Lines{strFailed + "execute db[0] cmd: BEGIN;DELETE FROM t; DELETE FROM r;COMMIT;.",
                   "kidb.cpp:ReplaceBoolForSqlite(): Got sql cmd with bool replaced: "
                   "SELECT n || '10011True' n FROM t",
                   strFailed + "connect to db[2, ]."}));
}

TEST_F(Database, ExecutorClosesItsConnections) {
  const rlimit Descriptors = {64, 64};  // too few for one that is left open each time
  setrlimit(RLIMIT_NOFILE, &Descriptors);
  for (int Time = 0; Time < 100; ++Time) {
    ASSERT_EQ(KiDB::Execute(KiDB::DBI_SYSTEM, "SELECT 1", nullptr, false), 0) << Time;
    ASSERT_EQ(KiDB::Execute(KiDB::DBI_SYSTEM, "SELECT x", nullptr, false), -1) << Time;
  }
}

}  // namespace

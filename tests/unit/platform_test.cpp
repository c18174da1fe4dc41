// Capability files, the database layer, and the executor on it.

#include "kidb.h"
#include "rig.h"
#include "zamoc.h"
#include "zamodb.h"

namespace {

using namespace std::string_literals;

constexpr const char* FILE_NAME = "/var/services/camveld/file";

ZAMOCPatience gPatience;

class CapabilityFile : public PrivateVar {};
class Database : public PrivateVar {};

TEST_F(CapabilityFile, LinesAreReadAndChanged) {
  const std::string strOthers = "#k=1\nK=2\nkk=3\nx=k\n=k\nk\n\r\n \n";
  const struct {
    std::string strBefore;
    std::string strGot;
    std::string strAfter;  // k was set
  } rgCase[] = {
      {strOthers, "", strOthers + "k= new\n"},
      {"a=1\nk=2\nb=3\nk=4\n\n k\t=5", "2", "a=1\nk= new\nb=3\n\n"},
      {" k\t=\t v= w \t\r\nb=3", "v= w", "k= new\nb=3"},
      {"k = \"a \"\r\n", "a ", "k= new\n"},
      {"k=\"\"a\"\"", "\"a\"", "k= new\n"},
      {"k=\"\n", "\"", "k= new\n"},
      {"k=\"a\n", "\"a", "k= new\n"},
      {"a=\0\nk=1\0002\n"s, "1\0002"s, "a=\0\nk= new\n"s},
  };
  for (const auto& Case : rgCase) {
    WriteFile(FILE_NAME, Case.strBefore);
    ZAMOCFile File(FILE_NAME, &gPatience);
    EXPECT_EQ(File.Get("k"), Case.strGot) << Case.strBefore;
    File.Set("k", "new", "%s= %s\n");
    EXPECT_EQ(File.Save(), 0);
    EXPECT_EQ(ReadFile(FILE_NAME), Case.strAfter);
  }
}

TEST_F(CapabilityFile, AllChangesAreMadeOrNone) {
  WriteFile(FILE_NAME, "k=1\n");
  for (const auto& [szValue, szFormat] : {std::pair("v", "%s=\n"),
                                          {"v", "%s=%s%n\n"},
                                          {"v", "%s=%s"},
                                          {"v", "#%s=%s\n"},
                                          {"v\nx=1", "%s=%s\n"}}) {
    ZAMOCFile File(FILE_NAME, &gPatience);
    File.Remove("k");
    File.Set("n", szValue, szFormat);
    EXPECT_EQ(File.Save(), -1) << szFormat;
  }
  EXPECT_EQ(ReadFile(FILE_NAME), "k=1\n");
}

TEST_F(CapabilityFile, ChangesOfOthersAreKept) {
  WriteFile(FILE_NAME, "k=1\nr=1\n");
  ZAMOCFile File(FILE_NAME, &gPatience);
  File.Set("k", "2", "%s=%s\n");
  File.Set("k", "3", "%s=%s\n");
  File.Remove("r");
  WriteFile(FILE_NAME, "other=1\nr=2\nk=2\n");
  EXPECT_EQ(File.Get("k"), "1");
  EXPECT_EQ(File.Save(), 0);
  EXPECT_EQ(ReadFile(FILE_NAME), "other=1\nk=3\n");
}

// Runs a text. Returns the number of rows and the values of column n in them, or "failed".
std::string Result(DBConnect* pConn, const char* szText) {
  DBResult* pResult = nullptr;
  DBRow Row = 0;
  if (ZAMODBExecute(pConn, szText, &pResult) != 0) {
    return "failed";
  }
  std::string strResult = std::to_string(ZAMODBNumRows(pResult));
  while (ZAMODBFetchRow(pResult, &Row) == 0) {
    const char* szField = ZAMODBFetchField(pResult, Row, "N");
    strResult.append(" ").append(szField == nullptr ? "null" : szField);
  }
  ZAMODBFreeResult(pResult);
  return strResult;
}

TEST_F(Database, TextsRunToTheirFirstFailure) {
  DBConnect* pConn = ZAMODBConnect(nullptr, nullptr, nullptr, SYSTEM_DB);
  EXPECT_EQ(Result(pConn, "CREATE TABLE t (n CHECK (n < 9));;; -- x\n ; INSERT INTO t VALUES (1)"),
            "0");
  EXPECT_EQ(Result(pConn, "SELECT 5 n; INSERT INTO t VALUES (3); SELECT 2 m, n FROM t"), "2 1 3");
  EXPECT_EQ(Result(pConn, "SELECT '' n UNION ALL SELECT NULL"), "2  null");
  EXPECT_EQ(Result(pConn, "INSERT INTO t VALUES (9); DELETE FROM t"), "failed");
  EXPECT_EQ(Result(pConn, "BEGIN; DELETE FROM t; SELECT x; COMMIT"), "failed");
  EXPECT_EQ(Result(pConn, "BEGIN; SELECT n FROM t; COMMIT"), "2 1 3");
  EXPECT_EQ(Result(pConn, "BEGIN; DELETE FROM t"), "failed");
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
}

}  // namespace

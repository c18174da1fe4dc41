// The database layer, the executor on it, and the capability-file layer.

#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <csignal>

#include "kidb.h"
#include "rig.h"
#include "utils.h"
#include "zamoc.h"
#include "zamodb.h"

using std::chrono::seconds;
using std::chrono::steady_clock;

namespace {

class Database : public Appliance {
 protected:
  void SetUp() override {
    Appliance::SetUp();
    Sql(SYSTEM_DB, "CREATE TABLE t (n PRIMARY KEY CHECK (n <> 13)); INSERT INTO t VALUES (1)");
  }

  static string Rows() { return Sql(SYSTEM_DB, "SELECT group_concat(n) FROM t"); }

  static int Run(const char* szSqlCmd, DBResult** ppResult = nullptr) {
    DBConnect* pConn = ZAMODBConnect("host", "user", "password", SYSTEM_DB);
    const int Ret = ZAMODBExecute(pConn, szSqlCmd, ppResult);
    ZAMODBClose(pConn);
    return Ret;
  }

  // Starts a process that has run szSqlCmd and keeps its connection for Seconds.
  static pid_t Hold(const string& strSqlCmd, int Seconds) {
    const RUN Run =
        RunCommand("({ echo '" + strSqlCmd + ";\n.shell echo $PPID >/var/pid'; sleep " +
                   itos(Seconds) + "; } | sqlite3 " + SYSTEM_DB + ") >/var/out 2>&1 & " +
                   "until [ -s /var/pid ]; do sleep 0.01; done; cat /var/pid; rm /var/pid");
    return std::stoi(Run.strOutput);
  }

  static void Kill(pid_t Pid) {
    while (kill(Pid, SIGKILL) == 0) {
      usleep(1000);
    }
  }
};

TEST_F(Database, ConnectsOnlyToAFileThatIsThereAndCanBeWritten) {
  RunCommand("mkfifo /var/fifo && mkdir /var/locked && cp " + string(SYSTEM_DB) +
             " /var/locked/db " +
             "&& mount --bind /var/locked /var/locked && mount -o remount,bind,ro /var/locked");
  for (const char* szName : {"", "/var/missing.db", "/var", "/var/fifo",
                             ":memory:", "/var/locked/db", static_cast<const char*>(nullptr)}) {
    EXPECT_EQ(ZAMODBConnect(nullptr, "postgres", nullptr, szName), nullptr) << szName;
  }
  EXPECT_FALSE(fs::exists("/var/missing.db"));
  EXPECT_EQ(umount("/var/locked"), 0);
}

TEST_F(Database, RunsEachStatementUntilOneFails) {
  for (const Lines& Row : ReadTable("statements.tsv")) {
    EXPECT_EQ(itos(Run(Row[0].c_str())), Row[1]) << Row[0];
    EXPECT_EQ(Rows(), Row[2] + "\n") << Row[0];
    Sql(SYSTEM_DB, "DELETE FROM t WHERE n > 1");
  }
}

TEST_F(Database, ResultSetHoldsCopiesOfTextAndMisuseIsAnError) {
  DBResult* pResult = nullptr;
  ASSERT_EQ(Run("SELECT 5 AS five; BEGIN; SELECT n AS N, 'a''b' AS txt, NULL AS none, x'4142' AS "
                "blob, -1.5 AS num FROM t UNION ALL SELECT 2,'','x',3,4; COMMIT",
                &pResult),
            0);
  Sql(SYSTEM_DB, "DROP TABLE t");
  ASSERT_EQ(ZAMODBNumRows(pResult), 2u);
  string strCells;
  DBRow Row = 9;
  while (ZAMODBFetchRow(pResult, &Row) == 0) {
    for (const char* szColumn : {"n", "TXT", "none", "blob", "num", "five"}) {
      const char* szValue = ZAMODBFetchField(pResult, Row, szColumn);
      strCells += szValue != nullptr ? string(szValue) + "," : "null,";
    }
  }
  EXPECT_EQ(strCells, "1,a'b,null,AB,-1.5,null,2,,x,3,4,null,");
  EXPECT_EQ(ZAMODBFetchField(pResult, Row + 1, "n"), nullptr);
  ZAMODBFreeResult(pResult);
  pResult = nullptr;
  ASSERT_EQ(Run("SELECT 1 AS n WHERE 0", &pResult), 0);
  ASSERT_NE(pResult, nullptr);
  EXPECT_EQ(ZAMODBNumRows(pResult), 0u);
  EXPECT_NE(ZAMODBFetchRow(pResult, &Row), 0);
  ZAMODBFreeResult(pResult);

  EXPECT_NE(ZAMODBExecute(nullptr, "SELECT 1", nullptr), 0);
  EXPECT_NE(Run(nullptr), 0);
  EXPECT_EQ(ZAMODBNumRows(nullptr), 0u);
  EXPECT_NE(ZAMODBFetchRow(nullptr, &Row), 0);
  EXPECT_EQ(ZAMODBFetchField(nullptr, 0, "n"), nullptr);
  ZAMODBFreeResult(nullptr);
  ZAMODBClose(nullptr);
}

TEST_F(Database, FailureIsReportedWithSqlitesReason) {
  SyslogSocket Syslog;
  EXPECT_EQ(Run("INSERT INTO t VALUES (13)"), -1);
  EXPECT_EQ(Run("SELECT x FROM t"), -1);
  WriteFile(SYSTEM_DB, string(4096, 'x'));
  EXPECT_EQ(Run("SELECT 1 FROM t"), -1);
  string strRecords;
  for (const string& strRecord : Syslog.Stop()) {
    strRecords += strRecord.substr(strRecord.find("zamodb: [" + string(SYSTEM_DB))) + "\n";
  }
  const string strStart = "zamodb: [" + string(SYSTEM_DB) + "]: ";
  EXPECT_EQ(strRecords, strStart + "CHECK constraint failed: n <> 13 (extended code 275)\n" +
                            strStart + "no such column: x (extended code 1)\n" + strStart +
                            "file is not a database (extended code 26)\n");
}

TEST_F(Database, ShortLockPassesAndALongOneFails) {
  const pid_t Short = Hold("BEGIN EXCLUSIVE", 1);
  EXPECT_EQ(Run("INSERT INTO t VALUES (2)"), 0);
  Kill(Short);
  const pid_t Long = Hold("BEGIN EXCLUSIVE", 60);
  const auto Start = steady_clock::now();
  EXPECT_EQ(Run("INSERT INTO t VALUES (3)"), -1);
  EXPECT_GE(steady_clock::now() - Start, seconds(4));
  Kill(Long);
  EXPECT_EQ(Rows(), "1,2\n");
}

TEST_F(Database, HotJournalsAndWalWorkAndStayAsTheyAre) {
  // A spilled cache puts half of a transaction into the file before its process dies.
  Kill(
      Hold("PRAGMA cache_size=1; BEGIN; INSERT INTO t SELECT value+100 FROM "
           "(WITH RECURSIVE c(value) AS (SELECT 0 UNION ALL SELECT value+1 FROM c LIMIT 5000) "
           "SELECT value FROM c)",
           60));
  ASSERT_GT(fs::file_size(string(SYSTEM_DB) + "-journal"), 0u);
  EXPECT_EQ(Run("INSERT INTO t VALUES (2)"), 0);
  EXPECT_EQ(Rows(), "1,2\n");

  const pid_t Reader = Hold("PRAGMA journal_mode=WAL; BEGIN; SELECT * FROM t", 60);
  EXPECT_EQ(Run("BEGIN;INSERT INTO t VALUES (3);COMMIT;"), 0);
  Kill(Reader);
  EXPECT_EQ(Rows(), "1,2,3\n");
  EXPECT_EQ(Sql(SYSTEM_DB, "PRAGMA journal_mode"), "wal\n");
}

TEST_F(Database, ExecuteReplacesBooleansAndHandsResultsOver) {
  const string strWords = "xTRUEfalseFALSEtruetrueTrue", strDigits = "x10011True";
  DBResult_tag* pResult = nullptr;
  for (const bool blReplace : {false, true}) {
    EXPECT_EQ(KiDB::Execute(KiDB::DBI_SYSTEM, "SELECT '" + strWords + "' v", &pResult, blReplace),
              0);
    DBRow Row = 0;
    ASSERT_EQ(ZAMODBFetchRow(pResult, &Row), 0);
    EXPECT_EQ(ZAMODBFetchField(pResult, Row, "v"), blReplace ? strDigits : strWords);
    KiDB::KiDBFreeResult(pResult);
    pResult = nullptr;
  }
  EXPECT_EQ(KiDB::Execute(KiDB::DBI_SYSTEM, "SELECT 1; SELECT x", &pResult, true), -1);
  EXPECT_EQ(KiDB::Execute(KiDB::DBI_RECORDING, "SELECT 1", &pResult, false), -1);
  EXPECT_EQ(KiDB::Execute(KiDB::DBI_CNT, "SELECT 1", &pResult, false), -1);
  EXPECT_EQ(pResult, nullptr);
  const Lines Expected = {
      "kidb.cpp:ReplaceBoolForSqlite(): Got sql cmd with bool replaced: SELECT '" + strDigits +
          "' v",
      "kidb.cpp:Execute(): Failed to execute db[0] cmd: BEGIN;SELECT 1; SELECT x;COMMIT;.",
      "kidb.cpp:Execute(): Failed to connect to db[1, /var/services/camveld/recording.db].",
      "kidb.cpp:Execute(): Failed to connect to db[2, ]."};
  EXPECT_EQ(LogLines(), Expected);
}

class CapabilityFile : public Appliance {
 protected:
  const string m_strFile = string(CAP_DIR) + "/file";

  int Set(const char* szKey, const char* szValue, const char* szFormat = "%s= %s\n") {
    return ZAMOCFileSetKeyValue(m_strFile.c_str(), szKey, szValue, szFormat);
  }

  static int FilesInDir() {
    return static_cast<int>(std::distance(fs::directory_iterator(CAP_DIR), {}));
  }
};

TEST_F(CapabilityFile, ReadsTheFirstLineOfAKey) {
  char szValue[8];
  for (const Lines& Row : ReadTable("capkeys.tsv")) {
    WriteFile(m_strFile, Row[0]);
    EXPECT_EQ(itos(ZAMOCFileGetKeyValue(m_strFile.c_str(), "k", szValue, sizeof(szValue), 0)),
              Row[1])
        << Row[0];
    EXPECT_EQ(szValue, Row[2]) << Row[0];
    EXPECT_EQ(ZAMOCFileGetKeyValue(m_strFile.c_str(), "", szValue, sizeof(szValue), 0), 0);
  }
  EXPECT_LT(ZAMOCFileGetKeyValue("/var/missing", "k", szValue, sizeof(szValue), 0), 0);
  EXPECT_LT(ZAMOCFileGetKeyValue(CAP_DIR, "k", szValue, sizeof(szValue), 0), 0);
}

TEST_F(CapabilityFile, ChangesTheLinesOfOneKeyAndNoOtherByte) {
  for (const Lines& Row : ReadTable("capchanges.tsv")) {
    WriteFile(m_strFile, Row[0]);
    EXPECT_EQ(Set("k", "v"), 0);
    EXPECT_EQ(ReadFile(m_strFile), Row[1]);
    WriteFile(m_strFile, Row[0]);
    EXPECT_EQ(itos(ZAMOCFileRemoveKey(m_strFile.c_str(), "k")), Row[3]);
    EXPECT_EQ(ReadFile(m_strFile), Row[2]);
  }
  WriteFile(m_strFile, "a=1\nb=2\nc=3");
  const ZAMOCKeyChange rgChange[] = {{"new", "4", "%s=%s\n"},
                                     {"b", nullptr, nullptr},
                                     {"c", "5", "%s=%s\n"},
                                     {"n", "6", "%s=%s\n"}};
  EXPECT_EQ(ZAMOCFileChangeKeys(m_strFile.c_str(), rgChange, 4), 0);
  EXPECT_EQ(ReadFile(m_strFile), "a=1\nc=5\nnew=4\nn=6\n");
}

TEST_F(CapabilityFile, ReplacementKeepsOwnerModeAndLink) {
  WriteFile("/var/target", "k=1\n");
  // An ordinary user's namespace knows no second owner.
  const bool blOwned = RunCommand("chown 1234:4321 /var/target").Status == 0;
  RunCommand("chmod 6741 /var/target; ln -s /var/target " + m_strFile);
  EXPECT_EQ(Set("k", "2"), 0);
  EXPECT_EQ(ReadFile("/var/target"), "k= 2\n");
  EXPECT_TRUE(fs::is_symlink(m_strFile));
  const string strStat = RunCommand("stat -c '%a %u %g' /var/target").strOutput;
  EXPECT_EQ(strStat, blOwned ? "6741 1234 4321\n" : "6741 0 0\n");
  const string strInode = RunCommand("stat -c %i /var/target").strOutput;
  EXPECT_EQ(ZAMOCFileRemoveKey(m_strFile.c_str(), "absent"), 0);
  EXPECT_EQ(RunCommand("stat -c %i /var/target").strOutput, strInode) << "written without need";
}

TEST_F(CapabilityFile, FailureLeavesTheFileAndNothingElse) {
  EXPECT_LT(Set("k", "v"), 0);
  EXPECT_LT(ZAMOCFileRemoveKey(m_strFile.c_str(), "k"), 0);
  EXPECT_EQ(FilesInDir(), 0);
  ASSERT_EQ(mkfifo(m_strFile.c_str(), 0666), 0);
  EXPECT_LT(Set("k", "v"), 0);
  fs::remove(m_strFile);

  ASSERT_EQ(mount("none", CAP_DIR, "tmpfs", 0, "size=16k"), 0);
  const string strContent = "a=" + string(9000, 'x') + "\nk=1\n";  // fits once
  WriteFile(m_strFile, strContent);
  EXPECT_LT(Set("k", "2"), 0);
  EXPECT_LT(ZAMOCFileRemoveKey(m_strFile.c_str(), "k"), 0);
  EXPECT_EQ(ReadFile(m_strFile), strContent);
  WriteFile(m_strFile, "k=1\n");
  for (const char* szKey : {"", " k", "#k", "k=", "k\n"}) {
    EXPECT_LT(Set(szKey, "v"), 0) << szKey;
  }
  EXPECT_LT(Set("k", "v\nx=1"), 0);
  for (const char* szFormat : {"%s=\n", "%s=%s%s\n", "%s=%d\n", "%s=%s%n\n", "%s=%s", "%s %s\n",
                               "#%s=%s\n", "%s=%s\nq=1\n"}) {
    EXPECT_LT(Set("k", "v", szFormat), 0) << szFormat;
  }
  EXPECT_EQ(ReadFile(m_strFile), "k=1\n");
  EXPECT_EQ(FilesInDir(), 1);

  // What a killed process left is no capability file, and goes with the next change.
  const string strTmp = string(CAP_DIR) + "/.tesselupgrader.tmp";
  WriteFile(strTmp, "k=1\n");
  char szValue[8];
  EXPECT_LT(ZAMOCFileGetKeyValue(strTmp.c_str(), "k", szValue, sizeof(szValue), 0), 0);
  EXPECT_EQ(Set("k", "2"), 0);
  EXPECT_EQ(FilesInDir(), 1);
  EXPECT_EQ(umount(CAP_DIR), 0);
}

}  // namespace

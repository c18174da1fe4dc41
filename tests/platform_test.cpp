// The database layer, the executor on it, and the capability-file layer.

#include "kidb.h"
#include "rig.h"
#include "utils.h"
#include "zamoc.h"
#include "zamodb.h"

namespace {

const string CD = "cd " + CAP_DIR + "; ";

class Database : public Appliance {
 protected:
  void SetUp() override {
    Appliance::SetUp();
    Sql(SYSTEM_DB, "CREATE TABLE t (n PRIMARY KEY CHECK (n <> 13)); INSERT INTO t VALUES (1)");
  }
  static string Rows() { return Sql(SYSTEM_DB, "SELECT group_concat(n) FROM t"); }

  // What was returned, and the columns n and V of a result set, which is freed.
  static string Show(int Ret, DBResult* pResult) {
    const auto Field = [pResult](DBRow Row, const char* szColumn) {
      const char* szValue = ZAMODBFetchField(pResult, Row, szColumn);
      return string(szValue != nullptr ? szValue : "null");
    };
    const unsigned Rows = ZAMODBNumRows(pResult);
    string strShown = itos(Ret) + (pResult != nullptr ? " " + itos(Rows) + " rows" : "");
    for (DBRow Row = 9; ZAMODBFetchRow(pResult, &Row) == 0;) {
      strShown += " " + Field(Row, "n") + "," + Field(Row, "V");
    }
    EXPECT_EQ(Field(Rows, "n") + Field(0, "none"), "nullnull");
    ZAMODBFreeResult(pResult);
    return strShown;
  }

  static string Run(const string& strSqlCmd, const char* szDBName = SYSTEM_DB.c_str()) {
    DBResult* pResult = nullptr;
    DBConnect* pConn = ZAMODBConnect("host", "user", "password", szDBName);
    const int Ret = ZAMODBExecute(pConn, strSqlCmd.c_str(), &pResult);
    EXPECT_EQ(ZAMODBExecute(pConn, "BEGIN; COMMIT", nullptr), pConn != nullptr ? 0 : -1);
    ZAMODBClose(pConn);
    return Show(Ret, pResult);
  }
};

TEST_F(Database, ConnectsOnlyToAFileThatIsThereAndCanBeWritten) {
  RunCommand("mkfifo /var/fifo; mkdir /var/ro; cp " + SYSTEM_DB + " /var/ro/db; " +
             "mount --bind /var/ro /var/ro; mount -o remount,bind,ro /var/ro");
  for (const char* szName : {"", "/var/none", "/var", "/var/fifo", ":memory:", "/var/ro/db"}) {
    EXPECT_EQ(Run("SELECT 1", szName), "-1") << szName;
  }
  EXPECT_EQ(Run("SELECT 1", nullptr), "-1");
  EXPECT_FALSE(fs::exists("/var/none"));
}

TEST_F(Database, RunsEachStatementUntilOneFailsForAReportedReason) {
  SyslogSocket Syslog;
  for (const Lines& Row : ReadTable("statements.tsv")) {
    EXPECT_EQ(Run(Row[0]), Row[1]) << Row[0];
    EXPECT_EQ(Rows(), Row[2] + "\n") << Row[0];
    const Lines Records = {"<11> zamodb: [" + SYSTEM_DB + "]: " + Row.back()};
    EXPECT_EQ(Syslog.Stop(), Row.size() > 3 ? Records : Lines());
    Sql(SYSTEM_DB, "DELETE FROM t WHERE n > 1");
  }
}

TEST_F(Database, ExecuteReplacesBooleansAndHandsResultsOver) {
  const string strQuery = "SELECT 'TRUEfalseFALSEtruetrueTrue' n";
  DBResult* pResult = nullptr;
  int Ret = KiDB::Execute(KiDB::DBI_SYSTEM, strQuery, &pResult, false);
  EXPECT_EQ(Show(Ret, pResult), "0 1 rows TRUEfalseFALSEtruetrueTrue,null");
  Ret = KiDB::Execute(KiDB::DBI_SYSTEM, strQuery, &pResult, true);
  EXPECT_EQ(Show(Ret, pResult), "0 1 rows 10011True,null");
  EXPECT_EQ(KiDB::Execute(KiDB::DBI_RECORDING, "SELECT 1", nullptr, false), -1);
  EXPECT_EQ(KiDB::Execute(KiDB::DBI_CNT, "SELECT 1", nullptr, false), -1);
  EXPECT_EQ(RunCommand("sed 's/.*[0-9]://' " + LOG_FILE).strOutput,
            "ReplaceBoolForSqlite(): Got sql cmd with bool replaced: SELECT '10011True' n\n"
            "Execute(): Failed to connect to db[1, /var/services/camveld/recording.db].\n"
            "Execute(): Failed to connect to db[2, ].\n");
}

class CapabilityFile : public Appliance {
 protected:
  string m_strFile = CAP_DIR + "/file";

  string Get(const char* szKey) {
    char szValue[8];
    const int Len = ZAMOCFileGetKeyValue(m_strFile.c_str(), szKey, szValue, sizeof(szValue), 0);
    return itos(Len) + " " + szValue;
  }
  int Set(const char* szKey, const char* szValue, const char* szFormat = "%s= %s\n") {
    return ZAMOCFileSetKeyValue(m_strFile.c_str(), szKey, szValue, szFormat);
  }
  int Remove(const char* szKey) { return ZAMOCFileRemoveKey(m_strFile.c_str(), szKey); }
  // What a call returned, and the file after it.
  string After(int Ret) { return itos(Ret) + " " + ReadFile(m_strFile); }
};

TEST_F(CapabilityFile, OneKeyIsReadSetAndRemovedAndNoOtherByteChanges) {
  for (const Lines& Row : ReadTable("capkeys.tsv")) {
    WriteFile(m_strFile, Row[0]);
    EXPECT_EQ(Get(""), "0 ");
    EXPECT_EQ(Get("k"), Row[1]) << Row[0];
    EXPECT_EQ(After(Set("k", "v")), Row[2]) << Row[0];
    WriteFile(m_strFile, Row[0]);
    EXPECT_EQ(After(Remove("k")), Row[3]) << Row[0];
  }
}

// Also one of the same size at the same time, and one behind a read that was long after the last.
TEST_F(CapabilityFile, ChangeByOthersIsSeen) {
  for (int Idx = 1000; Idx < 1300; ++Idx) {
    WriteFile(m_strFile, "k=" + itos(Idx));
    usleep(Idx < 1290 ? 0 : 30000);
    EXPECT_EQ(Get("k") + " " + Get("k"), "4 " + itos(Idx) + " 4 " + itos(Idx));
  }
}

TEST_F(CapabilityFile, FailedReadIsAnErrorAndReported) {
  SyslogSocket Syslog;
  m_strFile = "/proc/self/mem";
  EXPECT_EQ(Get("k"), "-1 ");
  EXPECT_EQ(Syslog.Stop(), Lines{"<11> zamoc: [/proc/self/mem]: read failed with errno [5]"});
}

TEST_F(CapabilityFile, ReplacementKeepsOwnerModeAndLink) {
  const string strStat = CD + "readlink file; stat -Lc '%a %u %g' file";
  // An ordinary user's namespace knows no second owner.
  RunCommand(CD + "ln -s /var/target file; echo k=1 >file; chown 12:34 file; chmod 6741 file; " +
             "ln /var/target /var/old");
  const string strBefore = RunCommand(strStat).strOutput;
  EXPECT_EQ(After(Remove("absent")), "0 k=1\n");
  EXPECT_EQ(fs::hard_link_count("/var/old"), 2u) << "replaced without need";
  EXPECT_EQ(After(Set("k", "2")), "0 k= 2\n");
  EXPECT_EQ(RunCommand(strStat).strOutput, strBefore);
}

TEST_F(CapabilityFile, FailureLeavesTheFileAndNothingElse) {
  // What a killed process left is no capability file, and goes with the next change.
  RunCommand(CD + "mkfifo fifo; mkdir dir; echo k=1 | tee .tesselupgrader.tmp >file");
  for (const string strName : {"none", "dir", "fifo", ".tesselupgrader.tmp", "file"}) {
    m_strFile.assign(CAP_DIR).append("/").append(strName);
    EXPECT_EQ(Get("k"), strName == "file" ? "1 1" : "-1 ") << strName;
    EXPECT_EQ(Set("k", "2") + Remove("none"), strName == "file" ? 0 : -2) << strName;
  }
  for (const char* szKey : {"", " k", "#k", "k=", "k\n"}) {
    EXPECT_EQ(Set(szKey, "v"), -1) << szKey;
  }
  for (const char* szFormat : {"%s=\n", "%s=%s%s\n", "%s=%d\n", "%s=%s%n\n", "%s=%s", "%s %s\n",
                               "#%s=%s\n", "%s=%s\nq=1\n"}) {
    EXPECT_EQ(Set("k", "v", szFormat), -1) << szFormat;
  }
  EXPECT_EQ(After(Set("k", "v\nx=1")), "-1 k= 2\n");
  EXPECT_EQ(RunCommand(CD + "ls -A").strOutput, "dir\nfifo\nfile\n");
}

}  // namespace

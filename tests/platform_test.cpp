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
    Sql(SYSTEM_DB, "CREATE TABLE t (n CHECK (n <> 13)); INSERT INTO t VALUES (1)");
  }
};

TEST_F(Database, ConnectsOnlyToAFileThatIsThereAndCanBeWritten) {
  RunCommand("mkfifo /var/fifo; mkdir /var/ro; cp " + SYSTEM_DB + " /var/ro/db; " +
             "mount --bind /var/ro /var/ro; mount -o remount,bind,ro /var/ro");
  for (const char* szName : {"", "/var/none", "/var", "/var/fifo", ":memory:", "/var/ro/db"}) {
    EXPECT_EQ(ZAMODBConnect("host", "user", "password", szName), nullptr) << szName;
  }
  EXPECT_EQ(ZAMODBConnect("host", "user", "password", nullptr), nullptr);
  EXPECT_FALSE(fs::exists("/var/none"));
}

TEST_F(Database, FailuresAreReportedAndMisuseHasNoEffect) {
  SyslogSocket Syslog;
  DBResult* pResult = nullptr;
  DBRow Row = 1;
  DBConnect* pConn = ZAMODBConnect("host", "user", "password", SYSTEM_DB.c_str());
  EXPECT_EQ(ZAMODBExecute(pConn, "INSERT INTO t VALUES (13)", &pResult), -1);
  EXPECT_EQ(ZAMODBExecute(pConn, "BEGIN; DELETE FROM t", nullptr), -1);
  EXPECT_EQ(ZAMODBExecute(pConn, "SELECT 5; SELECT n FROM t", &pResult), 0);
  ZAMODBClose(pConn);
  const string strStart = "<11> zamodb: [" + SYSTEM_DB + "]: ";
  EXPECT_EQ(Syslog.Stop(),
            Lines({strStart + "CHECK constraint failed: n <> 13 (extended code 275)",
                   strStart + "the text leaves a transaction open (extended code 0)"}));
  EXPECT_EQ(ZAMODBFetchField(pResult, 0, "n"), string("1"));
  EXPECT_EQ(ZAMODBFetchField(pResult, 0, "none"), nullptr);
  EXPECT_EQ(ZAMODBFetchField(pResult, 1, "n"), nullptr);
  EXPECT_EQ(ZAMODBFetchRow(nullptr, &Row) + ZAMODBExecute(nullptr, "", &pResult), -2);
  ZAMODBFreeResult(pResult);
  ZAMODBFreeResult(nullptr);
  ZAMODBClose(nullptr);
}

TEST_F(Database, ExecuteReplacesBooleansAndHandsResultsOver) {
  const string strQuery = "SELECT 'TRUEfalseFALSEtruetrueTrue' n";
  for (const string strExpected : {"TRUEfalseFALSEtruetrueTrue", "10011True"}) {
    DBResult* pResult = nullptr;
    const bool blReplace = strExpected[0] == '1';
    EXPECT_EQ(KiDB::Execute(KiDB::DBI_SYSTEM, strQuery, &pResult, blReplace), 0);
    EXPECT_EQ(ZAMODBFetchField(pResult, 0, "n"), strExpected);
    ZAMODBFreeResult(pResult);
  }
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

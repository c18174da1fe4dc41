// The database layer, the executor on it, and the capability-file layer.

#include <thread>

#include "kidb.h"
#include "rig.h"
#include "utils.h"
#include "zamoc.h"
#include "zamodb.h"

namespace {

class Database : public Appliance {};

TEST_F(Database, FailuresAreReportedAndMisuseHasNoEffect) {
  SyslogSocket Syslog;
  RunCommand("cd /var; mkfifo fifo; mkdir ro; touch ro/db " + SYSTEM_DB +
             "; mount --bind ro ro; mount -o remount,bind,ro ro");
  for (const char* szName : {"", "/var/none", "/var", "/var/fifo", ":memory:", "/var/ro/db"}) {
    EXPECT_EQ(ZAMODBConnect("host", "user", "password", szName), nullptr) << szName;
  }
  EXPECT_EQ(ZAMODBConnect("host", "user", "password", nullptr), nullptr);
  DBResult* pResult = nullptr;
  DBRow Row = 1;
  DBConnect* pConn = ZAMODBConnect("host", "user", "password", SYSTEM_DB.c_str());
  const char szMake[] = "CREATE TABLE t (n CHECK (n <> 13)); INSERT INTO t VALUES (1)";
  EXPECT_EQ(ZAMODBExecute(pConn, szMake, &pResult), 0);
  EXPECT_EQ(ZAMODBExecute(pConn, "INSERT INTO t VALUES (13)", &pResult), -1);
  EXPECT_EQ(ZAMODBExecute(pConn, "BEGIN; DELETE FROM t", nullptr), -1);
  EXPECT_EQ(ZAMODBExecute(pConn, "SELECT 5; SELECT n FROM t", &pResult), 0);
  ZAMODBClose(pConn);
  const string strStart = "<11> zamodb: [" + SYSTEM_DB + "]: ";
  EXPECT_EQ(Syslog.Stop(),
            Lines({"<11> zamodb: [/var/ro/db]: the file cannot be written (extended code 0)",
                   strStart + "CHECK constraint failed: n <> 13 (extended code 275)",
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
  DBResult* pResult = nullptr;
  WriteFile(SYSTEM_DB, "");
  EXPECT_EQ(KiDB::Execute(KiDB::DBI_SYSTEM, strQuery, nullptr, false), 0);
  EXPECT_EQ(KiDB::Execute(KiDB::DBI_SYSTEM, strQuery, &pResult, true), 0);
  EXPECT_EQ(ZAMODBFetchField(pResult, 0, "n"), string("10011True"));
  ZAMODBFreeResult(pResult);
  EXPECT_EQ(KiDB::Execute(KiDB::DBI_RECORDING, "SELECT 1", nullptr, false), -1);
  EXPECT_EQ(KiDB::Execute(KiDB::DBI_CNT, "SELECT 1", nullptr, false), -1);
  EXPECT_EQ(RunCommand("sed 's/.*[0-9]://' " + LOG_FILE),
            "ReplaceBoolForSqlite(): Got sql cmd with bool replaced: SELECT '10011True' n\n"
            "Execute(): Failed to connect to db[1, /var/services/camveld/recording.db].\n"
            "Execute(): Failed to connect to db[2, ].\n");
}

class CapabilityFile : public Appliance {};

string Get(const string& strFile) {
  char szValue[8];
  const int Len = ZAMOCFileGetKeyValue(strFile.c_str(), "k", szValue, sizeof(szValue), 0);
  return itos(Len) + " " + szValue;
}

TEST_F(CapabilityFile, ReadingIsOfOneMomentInItsThread) {
  WriteFile("/var/file", "k=1");
  {
    const ZAMOCReading Reading("/var/file"), Missing("/var/none");
    for (const char* szFile : {"/var/file", "/var/none"}) {
      WriteFile(szFile, "k=22");
    }
    EXPECT_EQ(Get("/var/file") + Get("/var/none") + Get("/var/../var/file"), "1 1-1 2 22");
    std::thread([] { EXPECT_EQ(Get("/var/file"), "2 22"); }).join();
    EXPECT_EQ(ZAMOCFileRemoveKey("/var/none", "k"), 1);
  }
  EXPECT_EQ(Get("/var/file") + Get("/var/none"), "2 220 ");
  SyslogSocket Syslog;
  EXPECT_EQ(Get("/proc/self/mem"), "-1 ");
  EXPECT_EQ(Syslog.Stop(), Lines{"<11> zamoc: [/proc/self/mem]: read failed with errno [5]"});
}

TEST_F(CapabilityFile, ReplacementIsWholeAndNotWithoutNeed) {
  const char *szNone = "/var/none", *szFile = "/var/link", *szFormat = "%s= %s\n";
  // What a killed process left is no capability file, and goes with the next change. An ordinary
  // user's namespace knows no second owner.
  const string strCd = "cd " + CAP_DIR + "; stat -c '%a %u %g' file; ";
  RunCommand(strCd +
             "echo k=1 | tee .zamoc.tmp >file; chown 12:34 file; chmod 6741 file; "
             "ln file /var/old; ln -s $PWD/file /var/link; mkfifo fifo");
  const string strBefore = RunCommand(strCd);
  EXPECT_EQ(Get(szNone) + Get(CAP_DIR + "/fifo") + Get(CAP_DIR + "/.zamoc.tmp"), "-1 -1 -1 ");
  EXPECT_EQ(ZAMOCFileSetKeyValue(szNone, "k", "2", szFormat), -1);
  EXPECT_EQ(ZAMOCFileRemoveKey(szNone, "k"), -1);
  for (const char* szBad : {"", " k", "#k", "k=", "k\n", "%s=\n", "%s=%s%s\n", "%s=%d\n",
                            "%s=%s%n\n", "%s=%s", "%s %s\n", "#%s=%s\n", "%s=%s\nq=1\n"}) {
    EXPECT_EQ(ZAMOCFileSetKeyValue(szFile, szBad, "v", szFormat), -1) << szBad;
    EXPECT_EQ(ZAMOCFileSetKeyValue(szFile, "k", "v", szBad), -1) << szBad;
  }
  EXPECT_EQ(ZAMOCFileSetKeyValue(szFile, "k", "v\nx=1", szFormat), -1);
  EXPECT_EQ(ZAMOCFileRemoveKey(szFile, "absent"), 0);
  EXPECT_EQ(fs::hard_link_count("/var/old"), 2u);
  EXPECT_EQ(ZAMOCFileSetKeyValue(szFile, "k", "2", szFormat), 0);
  EXPECT_EQ(RunCommand(strCd + "cat file /var/old; ls -A"), strBefore + "k= 2\nk=1\nfifo\nfile\n");
}

}  // namespace

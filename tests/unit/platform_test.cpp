// Capability files, the database layer, and the executor on it.

#include "kidb.h"
#include "rig.h"
#include "zamoc.h"
#include "zamodb.h"

namespace {

class Platform : public PrivateVar {};

TEST_F(Platform, AllChangesAreMadeBesideThoseOfOthersOrNone) {
  const char* const szFile = "/var/services/camveld/file";
  WriteFile(szFile, "k=1\nr=1\n");
  ZAMOCPatience Patience;
  ZAMOCFile File(szFile, &Patience);
  File.Set("k", "2", "%s=%s\n");
  File.Set("k", "3", "%s=%s\n");
  File.Remove("r");
  WriteFile(szFile, "other=1\nr=2\nk=2\n");
  EXPECT_EQ(File.Get("k"), "1");
  EXPECT_EQ(File.Save(), 0);
  File.Remove("k");
  File.Set("n", "v\nx=1", "%s=%s\n");
  EXPECT_EQ(File.Save(), -1);
  EXPECT_EQ(ReadFile(szFile), "other=1\nk=3\n");
}

TEST_F(Platform, ExecutorMakesATransactionOfEachText) {
  using namespace KiDB;
  const char* const szQuery =
      "SELECT n || 'TRUEfalseFALSEtruetrueTrue' n FROM t UNION ALL SELECT NULL";
  DBResult* pResult = nullptr;
  EXPECT_EQ(Execute(DBI_SYSTEM, "CREATE TABLE t (n); INSERT INTO t VALUES (1)", nullptr, true), 0);
  EXPECT_EQ(Execute(DBI_SYSTEM, "DELETE FROM t; DELETE FROM r", nullptr, true), -1);
  EXPECT_EQ(Execute(DBI_SYSTEM, szQuery, &pResult, true), 0);
  EXPECT_STREQ(ZAMODBFetchField(pResult, 0, "N"), "110011True");
  EXPECT_EQ(ZAMODBFetchField(pResult, 1, "N"), nullptr);
  KiDBFreeResult(pResult);
  EXPECT_EQ(Execute(DBI_SYSTEM, "SELECT 'true'", nullptr, false), 0);
  EXPECT_EQ(LogText(),
            "kidb.cpp:Execute(): Failed to execute db[0] cmd: "
            "BEGIN;DELETE FROM t; DELETE FROM r;COMMIT;.\n"
            "kidb.cpp:ReplaceBoolForSqlite(): Got sql cmd with bool replaced: "
            "SELECT n || '10011True' n FROM t UNION ALL SELECT NULL\n");
}

}  // namespace

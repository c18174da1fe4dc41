#include "cause.h"

#include <vector>

#include "database.h"
#include "sqltext.h"
#include "value.h"

namespace {

// Triggers act in here alone, as they do in an upgrade: they must not keep rows from being deleted.
bool Fails(const Database& Db, const std::string& strSqlCmd) {
  Db.Execute("SAVEPOINT text");
  sqlite3_db_config(Db.Get(), SQLITE_DBCONFIG_ENABLE_TRIGGER, 1, nullptr);
  const int Code = sqlite3_exec(Db.Get(), strSqlCmd.c_str(), nullptr, nullptr, nullptr);
  sqlite3_db_config(Db.Get(), SQLITE_DBCONFIG_ENABLE_TRIGGER, 0, nullptr);
  Db.Execute("ROLLBACK TO text; RELEASE text");
  return Code != SQLITE_OK;
}

bool FailsWithout(const Database& Db, const std::string& strSqlCmd, const std::string& strRows) {
  Db.Execute("SAVEPOINT rows; DELETE FROM " + strRows);
  const bool blFails = Fails(Db, strSqlCmd);
  Db.Execute(blFails ? "RELEASE rows" : "ROLLBACK TO rows; RELEASE rows");
  return blFails;
}

// Deletes half of the rows, again and again. Returns the rowid of the last one; "" if the text does
// not fail with either half.
std::string LastRow(const Database& Db, const std::string& strSqlCmd, const std::string& strTable) {
  WordMap Words = {{"table", strTable}};
  const std::string strCount = Fill("SELECT count(*) FROM {table}", Words);
  const std::string strMiddleRow = Fill(
      "SELECT rowid FROM {table} ORDER BY rowid LIMIT 1 OFFSET (SELECT count(*) / 2 FROM {table})",
      Words);
  while (Db.Run(strCount) != "1") {
    Words["middle"] = Db.Run(strMiddleRow);
    if (!FailsWithout(Db, strSqlCmd, Fill("{table} WHERE rowid >= {middle}", Words)) &&
        !FailsWithout(Db, strSqlCmd, Fill("{table} WHERE rowid < {middle}", Words))) {
      return "";
    }
  }
  return Db.Run(Fill("SELECT rowid FROM {table}", Words));
}

}  // namespace

std::string FindCause(const std::string& strCopy, const std::string& strSqlCmd) {
  try {
    const Database Db(strCopy, SQLITE_OPEN_READWRITE);
    std::vector<std::string> Tables;
    Statement List(Db,
                   "SELECT name FROM pragma_table_list WHERE schema = 'main' AND type = 'table' "
                   "AND NOT wr AND name NOT LIKE 'sqlite\\_%' ESCAPE '\\'");
    while (List.Step()) {
      Tables.push_back(List.Text(0));
    }
    Db.Execute("BEGIN");
    if (!Fails(Db, strSqlCmd)) {
      return "";  // it needs what other actions have done before
    }
    for (const std::string& strTable : Tables) {
      if (!FailsWithout(Db, strSqlCmd, Quoted(strTable))) {
        const std::string strRow = LastRow(Db, strSqlCmd, Quoted(strTable));
        return strRow.empty() ? "" : Name(strTable) + " " + strRow;
      }
      Db.Execute("ROLLBACK; BEGIN");
    }
  } catch (const SqlFailure&) {
    // For example, a trigger has rolled back the whole transaction. Then the name is missing; the
    // reason of the failure is known without it.
  }
  return "";
}

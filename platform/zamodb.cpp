#include "zamodb.h"

#include <sqlite3.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>
#include <memory>
#include <new>
#include <optional>
#include <string>
#include <vector>

#include "fileops.h"

struct DBConnect_tag {
  sqlite3* m_pDb = nullptr;

  // Closing the connection rolls back any open transaction.
  ~DBConnect_tag() {
    const fileops::NoCancel Guard;
    sqlite3_close(m_pDb);
  }
};

struct DBResult_tag {
  std::vector<std::string> m_Columns;
  std::vector<std::vector<std::optional<std::string>>> m_Rows;
  DBRow m_NextRow = 0;
};

namespace {

constexpr int BUSY_TIMEOUT_MSEC = 5000;

// The settings of each connection.
constexpr const char* SETTINGS =
    // What has ended outlasts a power cut, whatever this SQLite was built to do. EXTRA also syncs
    // the removal of the rollback journal, which ends a transaction.
    "PRAGMA synchronous = EXTRA;"
    // No temporary files: the appliance may have no directory for them.
    "PRAGMA temp_store = MEMORY;"
    // In KiB. A small cache of unchanged pages stays in the processor's: with SQLite's own size,
    // an upgrade takes 11 % longer if none of 20,000 cameras matches, and as long with 160. Changed
    // pages get SQLite's own size, because each write before the commit costs another sync.
    "PRAGMA cache_size = -128; PRAGMA cache_spill = -2000";

// Why the last call of this thread failed.
thread_local std::string gstrError;

struct StatementFinalizer {
  void operator()(sqlite3_stmt* pStatement) const {
    const fileops::NoCancel Guard;  // finalizing may end a transaction, and so write
    sqlite3_finalize(pStatement);
  }
};
using Statement = std::unique_ptr<sqlite3_stmt, StatementFinalizer>;

// Null if szPath leads to a regular file, else the reason.
const char* WhyNoRegularFile(const char* szPath) {
  struct stat Stat;
  if (stat(szPath, &Stat) != 0) {
    return strerror(errno);
  }
  if (S_ISREG(Stat.st_mode)) {
    return nullptr;
  }
  return S_ISDIR(Stat.st_mode) ? strerror(EISDIR) : "Not a regular file";
}

// The system's or this layer's reason.
void SetError(const char* szDBName, const char* szReason) {
  gstrError = std::string(szDBName) + ": " + szReason;
}

// SQLite's reason.
void SetError(sqlite3* pDb, const char* szReason) {
  const int Code = sqlite3_extended_errcode(pDb);
  gstrError = szReason + (" (extended code " + std::to_string(Code) + ")");
}

// Without memory statistics, which nobody reads, no allocation takes a lock. That saves 15 % of the
// instructions of an upgrade of 100 cameras. Fails without harm if the process has used SQLite.
bool ConfigureSqlite() { return sqlite3_config(SQLITE_CONFIG_MEMSTATUS, 0) == SQLITE_OK; }

// Appends the statement's current row to *pResult. Returns false if memory runs out.
bool CopyRow(sqlite3_stmt* pStatement, DBResult* pResult) {
  std::vector<std::optional<std::string>> Row(pResult->m_Columns.size());
  for (int Column = 0; Column < static_cast<int>(Row.size()); ++Column) {
    if (sqlite3_column_type(pStatement, Column) == SQLITE_NULL) {
      continue;
    }
    const void* pText = sqlite3_column_text(pStatement, Column);
    const int Len = sqlite3_column_bytes(pStatement, Column);
    if (pText == nullptr) {
      return false;
    }
    Row[static_cast<size_t>(Column)].emplace(static_cast<const char*>(pText),
                                             static_cast<size_t>(Len));
  }
  pResult->m_Rows.push_back(std::move(Row));
  return true;
}

// Runs one statement to its end. If it returns columns, its result set replaces *ppResult.
int RunStatement(sqlite3_stmt* pStatement, std::unique_ptr<DBResult>* ppResult) {
  const int Columns = sqlite3_column_count(pStatement);
  if (Columns > 0) {
    *ppResult = std::make_unique<DBResult>();
    for (int Column = 0; Column < Columns; ++Column) {
      const char* szName = sqlite3_column_name(pStatement, Column);
      (*ppResult)->m_Columns.emplace_back(szName != nullptr ? szName : "");
    }
  }
  int Step = sqlite3_step(pStatement);
  while (Step == SQLITE_ROW) {
    if (Columns > 0 && !CopyRow(pStatement, ppResult->get())) {
      return SQLITE_NOMEM;
    }
    Step = sqlite3_step(pStatement);
  }
  return Step == SQLITE_DONE ? SQLITE_OK : Step;
}

// Runs all statements of a text, up to the first that fails.
int RunText(sqlite3* pDb, const char* szSqlCmd, std::unique_ptr<DBResult>* ppResult) {
  while (*szSqlCmd != '\0') {
    sqlite3_stmt* pPrepared = nullptr;
    const int Prepare = sqlite3_prepare_v2(pDb, szSqlCmd, -1, &pPrepared, &szSqlCmd);
    if (Prepare != SQLITE_OK) {
      return Prepare;
    }
    const Statement pStatement(pPrepared);
    if (pStatement == nullptr) {  // an empty statement, or only a comment
      continue;
    }
    const int Run = RunStatement(pStatement.get(), ppResult);
    if (Run != SQLITE_OK) {
      return Run;
    }
  }
  return SQLITE_OK;
}

}  // namespace

DBConnect* ZAMODBConnect(const char* /*szHost*/, const char* /*szUser*/, const char* /*szPassword*/,
                         const char* szDBName) {
  // SQLite would open a temporary database for an empty name and one in memory for ":memory:".
  if (szDBName == nullptr) {
    szDBName = "";
  }
  if (const char* szReason = WhyNoRegularFile(szDBName)) {
    SetError(szDBName, szReason);
    return nullptr;
  }
  static const bool blConfigured = ConfigureSqlite();
  static_cast<void>(blConfigured);
  auto pConn = std::make_unique<DBConnect>();
  if (sqlite3_open_v2(szDBName, &pConn->m_pDb, SQLITE_OPEN_READWRITE, nullptr) != SQLITE_OK) {
    SetError(pConn->m_pDb, sqlite3_errmsg(pConn->m_pDb));
    return nullptr;
  }
  if (sqlite3_db_readonly(pConn->m_pDb, "main") != 0) {
    SetError(szDBName, "the file cannot be written");
    return nullptr;
  }
  // A text may contain what a camera's row says. Without ATTACH and VACUUM INTO, which both attach
  // a database, it reaches no other file.
  sqlite3_limit(pConn->m_pDb, SQLITE_LIMIT_ATTACHED, 0);
  sqlite3_busy_timeout(pConn->m_pDb, BUSY_TIMEOUT_MSEC);
  return pConn.release();
}

int ZAMODBExecute(DBConnect* pConn, const char* szSqlCmd, DBResult** ppResult) {
  if (pConn == nullptr || szSqlCmd == nullptr) {
    gstrError = "no connection or no text";
    return -1;
  }
  sqlite3* pDb = pConn->m_pDb;
  std::unique_ptr<DBResult> pResult;
  const char* szReason = nullptr;
  // The settings need the schema: if another process holds a lock, they wait as the text does.
  int Run = RunText(pDb, SETTINGS, &pResult);
  if (Run == SQLITE_OK) {
    Run = RunText(pDb, szSqlCmd, &pResult);
  }
  if (Run != SQLITE_OK) {
    // This layer may itself run out of memory, which SQLite's message would not show.
    szReason = Run == SQLITE_NOMEM ? sqlite3_errstr(Run) : sqlite3_errmsg(pDb);
  } else if (sqlite3_get_autocommit(pDb) == 0) {
    // Closing would roll the transaction back, so its changes would be lost without an error.
    szReason = "the text leaves a transaction open";
  }
  if (szReason != nullptr) {
    SetError(pDb, szReason);
    if (sqlite3_get_autocommit(pDb) == 0) {
      sqlite3_exec(pDb, "ROLLBACK", nullptr, nullptr, nullptr);
    }
    return -1;
  }
  if (ppResult != nullptr && pResult != nullptr) {
    *ppResult = pResult.release();
  }
  return 0;
}

const char* ZAMODBError() { return gstrError.c_str(); }

unsigned int ZAMODBNumRows(const DBResult* pResult) {
  return pResult == nullptr ? 0 : static_cast<unsigned int>(pResult->m_Rows.size());
}

int ZAMODBFetchRow(DBResult* pResult, DBRow* pRow) {
  if (pResult == nullptr || pRow == nullptr || pResult->m_NextRow >= pResult->m_Rows.size()) {
    return -1;
  }
  *pRow = pResult->m_NextRow++;
  return 0;
}

const char* ZAMODBFetchField(const DBResult* pResult, DBRow Row, const char* szColumn) {
  if (pResult == nullptr || szColumn == nullptr || Row >= pResult->m_Rows.size()) {
    return nullptr;
  }
  for (size_t Column = 0; Column < pResult->m_Columns.size(); ++Column) {
    if (sqlite3_stricmp(pResult->m_Columns[Column].c_str(), szColumn) == 0) {
      const std::optional<std::string>& Value = pResult->m_Rows[Row][Column];
      return Value ? Value->c_str() : nullptr;
    }
  }
  return nullptr;
}

void ZAMODBFreeResult(DBResult* pResult) { delete pResult; }

void ZAMODBClose(DBConnect* pConn) { delete pConn; }

#include "database.h"

#include "sqltext.h"

namespace {

constexpr int BUSY_TIMEOUT_MSEC = 5000;
constexpr int MAX_ATTACHED = 10;

// typeof(X) = typeof(Y) is the same, but takes half of the time of comparing two databases.
void SameType(sqlite3_context* pContext, int /*Count*/, sqlite3_value** ppValues) {
  sqlite3_result_int(pContext, sqlite3_value_type(ppValues[0]) == sqlite3_value_type(ppValues[1]));
}

void Configure(sqlite3* pDb) {
  for (const int Option : {SQLITE_DBCONFIG_ENABLE_TRIGGER, SQLITE_DBCONFIG_ENABLE_VIEW,
                           SQLITE_DBCONFIG_ENABLE_FKEY, SQLITE_DBCONFIG_TRUSTED_SCHEMA}) {
    sqlite3_db_config(pDb, Option, 0, nullptr);
  }
  sqlite3_db_config(pDb, SQLITE_DBCONFIG_DEFENSIVE, 1, nullptr);
  sqlite3_limit(pDb, SQLITE_LIMIT_ATTACHED, 0);
  sqlite3_busy_timeout(pDb, BUSY_TIMEOUT_MSEC);
  sqlite3_create_function(pDb, "same_type", 2, SQLITE_UTF8 | SQLITE_DETERMINISTIC, nullptr,
                          SameType, nullptr, nullptr);
}

}  // namespace

Database::Database(const std::string& strName, int Flags) {
  const int Code = sqlite3_open_v2(strName.c_str(), &m_pDb,
                                   Flags | SQLITE_OPEN_NOMUTEX | SQLITE_OPEN_URI, nullptr);
  if (Code != SQLITE_OK) {
    const std::string strReason = m_pDb == nullptr ? sqlite3_errstr(Code) : sqlite3_errmsg(m_pDb);
    sqlite3_close(m_pDb);
    throw SqlFailure(Code, strReason);
  }
  Configure(m_pDb);
}

void Database::CopyTo(const Database& To) const {
  sqlite3_backup* const pBackup = sqlite3_backup_init(To.Get(), "main", m_pDb, "main");
  if (pBackup == nullptr) {
    To.Throw(sqlite3_errcode(To.Get()));
  }
  sqlite3_backup_step(pBackup, -1);
  const int Code = sqlite3_backup_finish(pBackup);
  if (Code != SQLITE_OK) {
    To.Throw(Code);
  }
}

void Database::AttachReadOnly(const std::string& strFile, const std::string& strSchema) {
  std::string strUri = "file:";
  for (const char Char : strFile) {
    const bool blSpecial = Char == '%' || Char == '?' || Char == '#';
    strUri += !blSpecial ? std::string{Char} : Char == '%' ? "%25" : Char == '?' ? "%3f" : "%23";
  }
  Attach(strUri + "?mode=ro", strSchema);
}

void Database::Attach(const std::string& strFile, const std::string& strSchema) {
  sqlite3_limit(m_pDb, SQLITE_LIMIT_ATTACHED, MAX_ATTACHED);
  Run("ATTACH ? AS " + Quoted(strSchema), strFile);
  sqlite3_limit(m_pDb, SQLITE_LIMIT_ATTACHED, 0);
}

void Database::Execute(const std::string& strSql) const {
  const int Code = sqlite3_exec(m_pDb, strSql.c_str(), nullptr, nullptr, nullptr);
  if (Code != SQLITE_OK) {
    Throw(Code);
  }
}

void Database::Throw(int Code) const { throw SqlFailure(Code, sqlite3_errmsg(m_pDb)); }

Statement::Statement(const Database& Db, const std::string& strSql) : m_Db(Db) {
  Check(sqlite3_prepare_v2(Db.Get(), strSql.c_str(), -1, &m_pStatement, nullptr));
}

void Statement::Check(int Code) const {
  if (Code != SQLITE_OK) {
    m_Db.Throw(Code);
  }
}

void Statement::Bind(int Parameter, const std::string& strText) {
  sqlite3_reset(m_pStatement);
  Check(sqlite3_bind_text64(m_pStatement, Parameter, strText.data(), strText.size(),
                            SQLITE_TRANSIENT, SQLITE_UTF8));
}

void Statement::Bind(int Parameter, int64_t Number) {
  sqlite3_reset(m_pStatement);
  Check(sqlite3_bind_int64(m_pStatement, Parameter, Number));
}

void Statement::Bind(int Parameter, std::string_view Blob) {
  sqlite3_reset(m_pStatement);
  const char* const pBytes = Blob.empty() ? "" : Blob.data();  // a null pointer would bind NULL
  Check(sqlite3_bind_blob64(m_pStatement, Parameter, pBytes, Blob.size(), SQLITE_STATIC));
}

bool Statement::Step() {
  const int Code = sqlite3_step(m_pStatement);
  if (Code != SQLITE_ROW && Code != SQLITE_DONE) {
    m_Db.Throw(Code);
  }
  return Code == SQLITE_ROW;
}

std::string Statement::Text(int Column) const {
  const auto* pText = reinterpret_cast<const char*>(sqlite3_column_text(m_pStatement, Column));
  const auto Len = static_cast<size_t>(sqlite3_column_bytes(m_pStatement, Column));
  return pText == nullptr ? "" : std::string(pText, Len);
}

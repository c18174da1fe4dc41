#include "database.h"

Database::Database(const std::string& strName, int Flags) {
  const int Code = sqlite3_open_v2(strName.c_str(), &m_pDb, Flags | SQLITE_OPEN_NOMUTEX, nullptr);
  if (Code != SQLITE_OK) {
    const std::string strReason = m_pDb == nullptr ? sqlite3_errstr(Code) : sqlite3_errmsg(m_pDb);
    sqlite3_close(m_pDb);
    throw SqlFailure(Code, strReason);
  }
}

void Database::Execute(const std::string& strSql) {
  const int Code = sqlite3_exec(m_pDb, strSql.c_str(), nullptr, nullptr, nullptr);
  if (Code != SQLITE_OK) {
    Throw(Code);
  }
}

void Database::Throw(int Code) const { throw SqlFailure(Code, sqlite3_errmsg(m_pDb)); }

Statement::Statement(const Database& Db, const std::string& strSql) : m_Db(Db) {
  const int Code = sqlite3_prepare_v2(Db.Get(), strSql.c_str(), -1, &m_pStatement, nullptr);
  if (Code != SQLITE_OK) {
    Db.Throw(Code);
  }
}

void Statement::Bind(int Parameter, const std::string& strText) {
  sqlite3_reset(m_pStatement);
  const int Code = sqlite3_bind_text64(m_pStatement, Parameter, strText.data(), strText.size(),
                                       SQLITE_TRANSIENT, SQLITE_UTF8);
  if (Code != SQLITE_OK) {
    m_Db.Throw(Code);
  }
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

std::string Quoted(const std::string& strName) {
  std::string strQuoted = "\"";
  for (const char Char : strName) {
    strQuoted += Char;
    if (Char == '"') {
      strQuoted += Char;
    }
  }
  return strQuoted + '"';
}

// SQLite connections and statements that free themselves and throw.
#pragma once

#include <sqlite3.h>

#include <cstdint>
#include <string>
#include <string_view>

#include "failure.h"

// An error of SQLite: its message and result code.
class SqlFailure : public Failure {
 public:
  SqlFailure(int Code, const std::string& strWhat) : Failure(strWhat), m_Code(Code) {}
  // The primary result code.
  int Code() const { return m_Code & 0xff; }

 private:
  int m_Code;
};

// A connection, for one thread. Nothing that a database says acts on its own: there are no
// triggers, views or foreign keys, its schema calls only harmless functions, and only Attach()
// opens another file. Waits up to five seconds for a lock. All functions throw SqlFailure.
class Database {
 public:
  // strName is an absolute path, or "" for a temporary database. Flags are those of
  // sqlite3_open_v2.
  Database(const std::string& strName, int Flags);
  ~Database() { sqlite3_close(m_pDb); }
  Database(const Database&) = delete;
  Database& operator=(const Database&) = delete;
  sqlite3* Get() const { return m_pDb; }
  // Only reads another database, and never locks it for writing: a transaction would need a journal
  // over both, which a kill could leave behind.
  void AttachReadOnly(const std::string& strFile, const std::string& strSchema);
  // Replaces the content of another database by this one's.
  void CopyTo(const Database& To) const;
  void Attach(const std::string& strFile, const std::string& strSchema);
  void Execute(const std::string& strSql) const;
  // Runs one statement with values for its parameters. Returns the first column of its first row;
  // "" if there is none.
  template <typename... Values>
  std::string Run(const std::string& strSql, const Values&... Parameters) const;
  [[noreturn]] void Throw(int Code) const;

 private:
  sqlite3* m_pDb = nullptr;
};

class Statement {
 public:
  Statement(const Database& Db, const std::string& strSql);
  ~Statement() { sqlite3_finalize(m_pStatement); }
  Statement(const Statement&) = delete;
  Statement& operator=(const Statement&) = delete;
  sqlite3_stmt* Get() const { return m_pStatement; }
  // Each Bind first resets the statement. Text is copied. The bytes of a blob are not: they must
  // live until the statement has run.
  void Bind(int Parameter, const std::string& strText);
  void Bind(int Parameter, int64_t Number);
  void Bind(int Parameter, std::string_view Blob);
  // Goes to the next row. Returns false if there is none.
  bool Step();
  // Returns a column of the row; "" for NULL.
  std::string Text(int Column) const;
  int64_t Int(int Column) const { return sqlite3_column_int64(m_pStatement, Column); }
  // The value lives until the next step.
  sqlite3_value* Value(int Column) const { return sqlite3_column_value(m_pStatement, Column); }

 private:
  void Check(int Code) const;

  const Database& m_Db;
  sqlite3_stmt* m_pStatement = nullptr;
};

template <typename... Values>
std::string Database::Run(const std::string& strSql, const Values&... Parameters) const {
  Statement Once(*this, strSql);
  int Parameter = 0;
  (Once.Bind(++Parameter, Parameters), ...);
  return Once.Step() ? Once.Text(0) : "";
}

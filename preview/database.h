// SQLite connections and statements that free themselves and throw.
#pragma once

#include <sqlite3.h>

#include <string>

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

// A connection, for one thread. All functions throw SqlFailure.
class Database {
 public:
  // Flags are those of sqlite3_open_v2.
  Database(const std::string& strName, int Flags);
  ~Database() { sqlite3_close(m_pDb); }
  Database(const Database&) = delete;
  Database& operator=(const Database&) = delete;
  sqlite3* Get() const { return m_pDb; }
  void Execute(const std::string& strSql);
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
  void Bind(int Parameter, const std::string& strText);
  // Goes to the next row. Returns false if there is none.
  bool Step();
  // Returns a column of the row; "" for NULL.
  std::string Text(int Column) const;
  int Int(int Column) const { return sqlite3_column_int(m_pStatement, Column); }

 private:
  const Database& m_Db;
  sqlite3_stmt* m_pStatement = nullptr;
};

// Returns an identifier in double quotes.
std::string Quoted(const std::string& strName);

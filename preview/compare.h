// Compares two states of a database. The memory that this needs does not grow with the tables.
#pragma once

#include <string>
#include <vector>

#include "database.h"

struct ColumnInfo {
  std::string strName;
  bool blGenerated;  // computed from other columns: cannot be set
};

struct TableInfo {
  std::string strName;
  std::vector<ColumnInfo> Columns;
  // What identifies a row: a name of its rowid, or the columns of its primary key.
  std::vector<std::string> Keys;
  bool blHasRowid = false;
  int Vendor = -1;  // the columns that name a camera; -1 in other tables
  int Model = -1;
};

// The current row of a statement: keys first, then columns.
class TableRow {
 public:
  TableRow(const TableInfo& Table, sqlite3_stmt* pStatement, int First)
      : m_Table(Table), m_pStatement(pStatement), m_First(First) {}
  const TableInfo& Table() const { return m_Table; }
  sqlite3_value* Key(size_t Idx) const {
    return sqlite3_column_value(m_pStatement, m_First + static_cast<int>(Idx));
  }
  sqlite3_value* Column(size_t Idx) const { return Key(m_Table.Keys.size() + Idx); }

 private:
  const TableInfo& m_Table;
  sqlite3_stmt* const m_pStatement;
  const int m_First;
};

// Receives the differences, table by table. Ignores those whose function is not overridden.
class ChangeSink {
 public:
  virtual ~ChangeSink() = default;
  virtual void Cell(const TableRow& /*Before*/, const TableRow& /*After*/, size_t /*Column*/) {}
  virtual void Added(const TableRow& /*After*/) {}
  virtual void Removed(const TableRow& /*Before*/) {}
  // strWhat is "view" or "virtual table", or the reason.
  virtual void NotCompared(const std::string& /*strTable*/, const std::string& /*strWhat*/) {}
};

// Compares the database attached as "after" with "main". Only pBookkeeping, which may be null,
// receives the changes of sqlite_sequence, SQLite's own table. Throws SqlFailure.
void Compare(const Database& Db, ChangeSink* pSink, ChangeSink* pBookkeeping);

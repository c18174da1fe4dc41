// What differs between two states of a database. Memory does not grow with its tables.
#pragma once

#include <string>
#include <vector>

#include "database.h"

struct ColumnInfo {
  std::string strName;
  bool blGenerated;  // it follows from others and cannot be set
};

struct TableInfo {
  std::string strName;
  std::vector<ColumnInfo> Columns;
  // What a row is known by: a name of its rowid, or the columns of its primary key.
  std::vector<std::string> Keys;
  bool blHasRowid = false;
  int Vendor = -1;  // columns that name a camera, in the table of cameras
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

// Receives the differences, table by table.
class ChangeSink {
 public:
  virtual ~ChangeSink() = default;
  virtual void Cell(const TableRow& Before, const TableRow& After, size_t Column) = 0;
  virtual void Added(const TableRow& After) = 0;
  virtual void Removed(const TableRow& Before) = 0;
  // strWhat is "view" or "virtual table", or the reason.
  virtual void NotCompared(const std::string& strTable, const std::string& strWhat) = 0;
};

// Compares the database attached as "after" with "main". SQLite's own table of the highest row
// numbers goes to pBookkeeping alone, which may be null. Throws SqlFailure.
void Compare(const Database& Db, ChangeSink* pSink, ChangeSink* pBookkeeping);

// Takes back the changes of one table.
//
// The temporary table row_N says what becomes of each row of the change file:
//   k0, k1, ...       its keys
//   kind              'changed', 'added' or 'removed' by the upgrade
//   back, done, lost  how many of its changes are to be set back, are as before already, and have
//                     been changed since
//   whole             each of its columns holds its value before or after the upgrade
//   r                 the rowid that it is to have, if no column holds it
//   reason            why the whole row is left, or NULL
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "changefile.h"

// What has become of cells, rows and files.
struct Counts {
  int64_t Back = 0;  // set back
  int64_t Left = 0;  // left, and named
  int64_t Done = 0;  // as before already
};

// A row of row_N, by its rowid, that must be left, and why.
struct LeftRow {
  int64_t Number;
  int64_t Row;
  std::string strReason;
};

// SQL: the row x of row_N goes back.
constexpr const char* GOES_BACK = "x.back > 0 AND x.reason IS NULL";

// One table. All functions run in one transaction and throw SqlFailure.
class TableUndo {
 public:
  // Db is the recorder's database, with the change file attached as "changes". If blRebuilt, SQLite
  // may have given other rowids to the rows.
  TableUndo(const Database& Db, const ChangedTable& Table, bool blRebuilt);

  const ChangedTable& Table() const { return m_Table; }

  // True if rows of the table can go back. Only then is there a row_N.
  bool CanGoBack() const { return m_strReason.empty(); }

  // Creates row_N.
  void Classify() const;

  // Marks the rows of Left that belong to this table, so that they stay.
  void Leave(const std::vector<LeftRow>& Left) const;

  // Takes back what goes back. All rows go before the first comes back, because SQLite checks
  // UNIQUE row by row. Appends the rows that the table then refuses to *pLeft.
  void Apply(std::vector<LeftRow>* pLeft) const;

  // Prints a line for each change that is left, and adds up all changes.
  void Print(Counts* pCounts) const;

 private:
  std::string FindReason(bool blRebuilt) const;
  void Execute(const std::string& strPattern) const { m_Db.Execute(Fill(strPattern, m_Words)); }

  const Database& m_Db;
  const ChangedTable m_Table;
  const WordMap m_Words;          // of the patterns of all statements
  const std::string m_strReason;  // why no row of the table can go back; empty if rows can
};

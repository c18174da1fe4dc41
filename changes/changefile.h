// The change file: an SQLite database that holds what an upgrade changes, in the encoding of the
// recorder's database. Values are stored as they are there, and never become SQL text.
//
//   upgrade    one row: what was upgraded, by what
//   covered    a row a table or view of the database: how its rows are stored, or why they are not
//   before_N   the rows of table N that the upgrade changes or removes, as they are before
//   after_N    the rows that it changes or adds, as they are afterwards
//   dangling   the foreign keys of rows that lead nowhere before the upgrade
//   file       a row a capability file that it changes: name, before, after
//
// The columns of before_N and after_N are k0, k1, ... for the keys and c0, c1, ... for the columns
// of the table, declared without a type, so that no value is converted. A changed row has the same
// keys in both. In before_N the column r follows, the rowid; it is NULL if the table has none.
//
// Two values are the same if SQLite compares them as equal, text byte by byte, and their types are
// the same. So 0.0 and -0.0 are the same.
//
// All functions throw Failure.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "database.h"
#include "sqltext.h"

struct Upgrade {
  std::string strVersion;  // of the package that is replaced
  std::string strTool;     // the program
  std::string strToolVersion;
  std::string strDatabase;    // the recorder's database, without links
  int64_t Inode = 0;          // of that file
  int64_t SchemaVersion = 0;  // PRAGMA schema_version of that database; each VACUUM changes it
};

struct ChangedTable {
  int64_t Number = 0;
  std::string strName;
  std::vector<std::string> Keys;        // columns that identify a row, or a name of the rowid
  std::vector<std::string> Collations;  // of the keys
  std::vector<std::string> Columns;     // those that are not generated, in order
  std::string strRowid;                 // a name of the rowid; empty if there is none to use
  std::string strKeyIndex;              // the index of the primary key, if a row is found by it
  bool blRowidOnly = false;   // nothing but the rowid identifies a row; VACUUM may change it
  std::string strDefinition;  // its CREATE statement
  // Why the table is not covered: then there are no before_N and after_N. Empty if it is covered.
  std::string strReason;
  bool blDoubt = false;  // not covered, although the upgrade changes it or nobody can tell
  // What names a camera: columns, counted from 0. -1 in other tables.
  int Vendor = -1;
  int Model = -1;

  bool IsCamera() const { return Vendor != -1 && Model != -1; }
};

// Creates strFile (mode 0600) from the databases before and after. All names are absolute. The file
// is not synced.
void MakeChangeFile(const std::string& strFile, const std::string& strBefore,
                    const std::string& strAfter, const Upgrade& Info);

// Adds a capability file to the change file. Does not copy the contents.
void AddFile(const Database& Changes, const std::string& strName, std::string_view Before,
             std::string_view After);

// Read the change file that is open as Changes. They refuse another file, and another format.
Upgrade ReadUpgrade(const Database& Changes);
std::vector<ChangedTable> ReadTables(const Database& Changes);

// Returns the place of a name, which SQLite compares without regard to case, or -1.
int FindName(const std::vector<std::string>& Names, const std::string& strName);

// --- SQL ---

// "x0, x1, ...", one for each name, with strPrefix in the place of x.
std::string Numbered(const std::string& strPrefix, const std::vector<std::string>& Names);

// Counts the foreign keys of rows in the database strSchema that lead nowhere, and adds them to the
// table strList (child, row, parent, id, count).
void ListDangling(const Database& Db, const std::string& strSchema, const std::string& strList);

// Fills the pattern for each key of the table, as ForEach() does. {collation} is the key's.
std::string ForEachKey(const ChangedTable& Table, const std::string& strPattern,
                       const std::string& strBetween);

// True if the row strRow of the table has these keys. strKey stands for each of them, as a pattern
// of ForEach: "b.k{i}" for a row b of the change file, "t.{name}" for another row of the table.
std::string SameKeys(const ChangedTable& Table, const std::string& strRow,
                     const std::string& strKey);

// A text that names a row, such as "camera 12" or "TABLE 'a', 2", and what follows it for a camera,
// " (VENDOR MODEL)". strKey and strCell stand for its keys and columns. Need AddPrintFunctions().
std::string RowName(const ChangedTable& Table, const std::string& strKey);
std::string CameraName(const ChangedTable& Table, const std::string& strCell);

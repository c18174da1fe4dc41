// The way back from an upgrade.
#pragma once

#include <cstdio>
#include <memory>
#include <string>
#include <vector>

#include "compare.h"

// Writes a script for the sqlite3 shell that sets every cell and row back which is still as the
// upgrade left it, in one transaction, and says how many those were.
class UndoScript : public ChangeSink {
 public:
  // Throws Failure, as Close does.
  UndoScript(const std::string& strFile, const std::string& strVersion);
  void Cell(const TableRow& Before, const TableRow& After, size_t Column) override;
  void Added(const TableRow& After) override;
  void Removed(const TableRow& Before) override;
  void NotCompared(const std::string& strTable, const std::string& strWhat) override;
  // Writes the end: the cells are set back when all rows are there again.
  void Close();

 private:
  void Write(const std::string& strText);
  void WriteColumn(size_t Idx, size_t Column);
  void WriteState(const TableRow& Row, const std::string& strDone);

  const std::string m_strFile;
  std::unique_ptr<FILE, int (*)(FILE*)> m_pFile;
  std::vector<TableInfo> m_Tables;           // that cells have changed in
  std::vector<std::vector<bool>> m_Columns;  // of each of them, which ones
};

// A new directory for the way back, or one that is there and empty. It disappears again unless it
// is given all its files.
class UndoDirectory {
 public:
  // Throws Failure, as Deliver does.
  explicit UndoDirectory(const std::string& strDir);
  ~UndoDirectory();
  UndoDirectory(const UndoDirectory&) = delete;
  UndoDirectory& operator=(const UndoDirectory&) = delete;
  // Copies a file into the directory: it has its name when it is complete and on stable storage.
  void Deliver(const std::string& strFrom, const std::string& strName);

 private:
  const std::string m_strDir;
  bool m_blMade = false;
};

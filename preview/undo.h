// The way back from an upgrade.
#pragma once

#include <cstdio>
#include <memory>
#include <string>
#include <vector>

#include "compare.h"

// Writes a script for the sqlite3 shell. In one transaction, the script sets back every cell and
// row that still is as the upgrade left it, and prints how many it has set back.
class UndoScript : public ChangeSink {
 public:
  // Throws Failure, as Close does.
  UndoScript(const std::string& strFile, const std::string& strVersion);
  void Cell(const TableRow& Before, const TableRow& After, size_t Column) override;
  void Added(const TableRow& After) override;
  void Removed(const TableRow& Before) override;
  // Writes the end of the script. It sets the cells back, after the rows before it are restored.
  void Close();

 private:
  void Write(const std::string& strText);
  void WriteColumn(size_t Idx, size_t Column);
  void WriteState(const TableRow& Row, const std::string& strDone);

  const std::string m_strFile;
  std::unique_ptr<FILE, int (*)(FILE*)> m_pFile;
  std::vector<TableInfo> m_Tables;           // tables with changed cells
  std::vector<std::vector<bool>> m_Columns;  // for each such table: which columns have changed
};

// The directory with the way back: a new one, or an existing empty one. The destructor removes a
// new one that is still empty.
class UndoDirectory {
 public:
  // Throws Failure, as Deliver does.
  explicit UndoDirectory(const std::string& strDir);
  ~UndoDirectory();
  UndoDirectory(const UndoDirectory&) = delete;
  UndoDirectory& operator=(const UndoDirectory&) = delete;
  // Copies a file into the directory. It gets its name once it is complete and on stable storage.
  void Deliver(const std::string& strFrom, const std::string& strName);

 private:
  const std::string m_strDir;
  bool m_blMade = false;
};

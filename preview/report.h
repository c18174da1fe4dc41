// Prints what a change file holds.
#pragma once

#include <cstdint>
#include <string>

#include "changefile.h"
#include "database.h"
#include "options.h"
#include "tool.h"

// How much a change file holds.
struct Counts {
  int64_t CameraCells = 0;
  int64_t Cameras = 0;
  int64_t OtherCells = 0;
  int64_t Added = 0;
  int64_t Removed = 0;
  int64_t Files = -1;  // -1: there are no capability files
  int64_t Failed = 0;  // actions

  bool IsEmpty() const { return CameraCells + OtherCells + Added + Removed == 0 && Files <= 0; }
};

// Counts and, as the mode says, prints. All functions throw SqlFailure.
class Report {
 public:
  // Changes is the open change file.
  Report(const Database& Changes, OutputMode Mode, bool blCaps);

  // The changed cells, the removed and the added rows of a table, or why it is not compared.
  void Table(const ChangedTable& Table);
  // A changed capability file. strDiff shows how it changes.
  void File(const std::string& strName, const std::string& strDiff);
  // strCause is the row that is enough to make the action fail, if that is known.
  void Failed(const FailedAction& Failed, const std::string& strCause) const;
  // The last line. Status is the exit status of the tool.
  void Summary(int Status) const;

  Counts m_Counts;

 private:
  void NotCompared(const ChangedTable& Table) const;
  int64_t PrintLines(const std::string& strSql, int64_t* pRows) const;

  const Database& m_Changes;
  const OutputMode m_Mode;
};

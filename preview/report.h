// The output of a preview.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "compare.h"
#include "tool.h"

// Counts what changes.
class Tally : public ChangeSink {
 public:
  void Cell(const TableRow& Before, const TableRow& After, size_t Column) override;
  void Added(const TableRow& After) override;
  void Removed(const TableRow& Before) override;
  bool IsEmpty() const;

  int64_t m_CameraCells = 0;
  int64_t m_Cameras = 0;
  int64_t m_OtherCells = 0;
  int64_t m_Added = 0;
  int64_t m_Removed = 0;
  int64_t m_Files = -1;  // capability files that change; -1 if none were compared
  int64_t m_Failed = 0;  // failed actions
  int m_Status = 0;      // the exit status of the tool

 private:
  int64_t m_LastCamera = 0;
};

// Prints each change when it arrives.
class Report : public ChangeSink {
 public:
  virtual void File(const std::string& /*strName*/, const std::string& /*strDiff*/) {}
  virtual void Failed(const FailedAction& /*Failed*/) {}
  virtual void Summary(const Tally& Counts) = 0;
};

// Prints the summary only, as text.
class SummaryReport : public Report {
 public:
  void Summary(const Tally& Counts) override;
};

// Prints everything as text.
class TextReport : public SummaryReport {
 public:
  explicit TextReport(bool blColour) : m_blColour(blColour) {}
  void Cell(const TableRow& Before, const TableRow& After, size_t Column) override;
  void Added(const TableRow& After) override;
  void Removed(const TableRow& Before) override;
  void NotCompared(const std::string& strTable, const std::string& strWhat) override;
  void File(const std::string& strName, const std::string& strDiff) override;
  void Failed(const FailedAction& Failed) override;

 private:
  void PrintRow(const TableRow& Row, const char* szWhat, const char* szColour) const;
  std::string Coloured(const char* szColour, const std::string& strText) const;

  const bool m_blColour;
};

// Prints everything as JSON Lines, one object per change.
class JsonReport : public Report {
 public:
  void Cell(const TableRow& Before, const TableRow& After, size_t Column) override;
  void Added(const TableRow& After) override;
  void Removed(const TableRow& Before) override;
  void NotCompared(const std::string& strTable, const std::string& strWhat) override;
  void File(const std::string& strName, const std::string& strDiff) override;
  void Failed(const FailedAction& Failed) override;
  void Summary(const Tally& Counts) override;
};

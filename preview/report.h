// What a preview prints.
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
  void NotCompared(const std::string& strTable, const std::string& strWhat) override;
  bool IsEmpty() const;

  int64_t m_CameraCells = 0;
  int64_t m_Cameras = 0;
  int64_t m_OtherCells = 0;
  int64_t m_Added = 0;
  int64_t m_Removed = 0;
  int64_t m_Files = -1;  // not looked at
  int64_t m_Failed = 0;  // actions
  int m_Status = 0;      // the tool's

 private:
  int64_t m_LastCamera = 0;
};

// Prints each change as it comes.
class Report : public ChangeSink {
 public:
  virtual void File(const std::string& strName, const std::string& strDiff) = 0;
  virtual void Failed(const FailedAction& Failed) = 0;
  virtual void Summary(const Tally& Counts) = 0;
};

// The summary alone, for a person.
class SummaryReport : public Report {
 public:
  void Cell(const TableRow& Before, const TableRow& After, size_t Column) override;
  void Added(const TableRow& After) override;
  void Removed(const TableRow& Before) override;
  void NotCompared(const std::string& strTable, const std::string& strWhat) override;
  void File(const std::string& strName, const std::string& strDiff) override;
  void Failed(const FailedAction& Failed) override;
  void Summary(const Tally& Counts) override;
};

// Everything, for a person.
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

// Everything, as JSON Lines: an object a change.
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

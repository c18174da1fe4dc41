// Finds the rows that must be left because of a foreign key: those that another row refers to, and
// those that refer to a row that is gone.
#pragma once

#include <string>
#include <vector>

#include "rows.h"

struct BrokenReference {
  std::string strChild;
  std::string strRow;  // the rowid of the row that refers to nothing; "" if it has none
  std::string strParent;
  int64_t Id;  // of the foreign key
};

// Used in one transaction. All functions throw SqlFailure.
class References {
 public:
  // Before the rows go back: remembers the references that lead nowhere already.
  References(const Database& Db, const std::vector<TableUndo>& Tables);

  // After the rows have gone back: finds the references that lead nowhere now. Appends the rows
  // that have come back with one to *pLeft. Returns the references of other rows.
  std::vector<BrokenReference> Check(std::vector<LeftRow>* pLeft) const;

  // After that has been rolled back: appends the rows that they refer to. Accepts from now on a
  // reference for which there is no such row.
  void FindParents(const std::vector<BrokenReference>& Broken, std::vector<LeftRow>* pLeft) const;

 private:
  WordMap Describe(const ChangedTable& Table, const BrokenReference& Reference) const;
  bool Find(const std::string& strTable, const char* szPattern, const BrokenReference& Reference,
            const std::string& strReason, std::vector<LeftRow>* pLeft) const;

  const Database& m_Db;
  const std::vector<TableUndo>& m_Tables;
};

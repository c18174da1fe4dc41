// Finds the rows that must be left because of a foreign key: those that another row refers to, and
// those that refer to a row that is gone.
#pragma once

#include <string>
#include <vector>

#include "rows.h"

// Used in several transactions, one after the other. All functions throw SqlFailure.
class References {
 public:
  explicit References(const Database& Db) : m_Db(Db) {}

  // Before the rows go back: remembers the references that lead nowhere already. Appends the rows
  // to *pLeft that must be left because Check() has failed in the last transaction.
  void Prepare(const std::vector<TableUndo>& Tables, std::vector<LeftRow>* pLeft);

  // After the rows have gone back: returns true if every reference leads to a row, or led nowhere
  // before. Otherwise the transaction cannot be kept, and more rows must be left in the next.
  // Appends those that are known already to *pLeft.
  bool Check(const std::vector<TableUndo>& Tables, std::vector<LeftRow>* pLeft);

 private:
  struct Broken {
    std::string strChild;
    std::string strRow;  // the rowid of the row that refers to nothing; "" if it has none
    std::string strParent;
    int64_t Id;  // of the foreign key

    bool operator==(const Broken& Other) const {
      return strChild == Other.strChild && strRow == Other.strRow && Id == Other.Id;
    }
  };

  WordMap Describe(const ChangedTable& Table, const Broken& Reference) const;
  bool Find(const std::vector<TableUndo>& Tables, const std::string& strTable,
            const char* szPattern, const Broken& Reference, const std::string& strReason,
            std::vector<LeftRow>* pLeft) const;

  const Database& m_Db;
  std::vector<Broken> m_Missed;    // the rows that they refer to must be left
  std::vector<Broken> m_Accepted;  // there is no row to leave for them
};

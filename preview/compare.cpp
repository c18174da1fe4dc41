#include "compare.h"

#include <algorithm>

#include "value.h"

namespace {

struct ListedTable {
  std::string strName;
  std::string strType;
  bool blHasRowid;
};

std::vector<ListedTable> ListTables(const Database& Db) {
  Statement List(Db,
                 "SELECT name, type, NOT wr FROM pragma_table_list WHERE schema = 'main' AND "
                 "(name NOT LIKE 'sqlite\\_%' ESCAPE '\\' OR name = 'sqlite_sequence') "
                 "ORDER BY name");
  std::vector<ListedTable> Tables;
  while (List.Step()) {
    Tables.push_back({List.Text(0), List.Text(1), List.Int(2) != 0});
  }
  return Tables;
}

bool IsName(const std::string& strA, const std::string& strB) {
  return sqlite3_stricmp(strA.c_str(), strB.c_str()) == 0;
}

int FindColumn(const TableInfo& Table, const std::string& strName) {
  const auto Column =
      std::find_if(Table.Columns.begin(), Table.Columns.end(),
                   [&](const ColumnInfo& It) { return IsName(It.strName, strName); });
  return Column == Table.Columns.end() ? -1 : static_cast<int>(Column - Table.Columns.begin());
}

void ReadColumns(const Database& Db, TableInfo* pTable) {
  Statement Info(Db, "SELECT name, hidden FROM pragma_table_xinfo(?, 'main')");
  Info.Bind(1, pTable->strName);
  while (Info.Step()) {
    pTable->Columns.push_back({Info.Text(0), Info.Int(1) != 0});
  }
  if (IsName(pTable->strName, "camera")) {
    pTable->Vendor = FindColumn(*pTable, "vendor");
    pTable->Model = FindColumn(*pTable, "model");
  }
}

// Leaves the keys empty if columns hide all names of the rowid.
void ReadKeys(const Database& Db, TableInfo* pTable) {
  for (const char* szName : {"rowid", "_rowid_", "oid"}) {
    if (pTable->blHasRowid && pTable->Keys.empty() && FindColumn(*pTable, szName) == -1) {
      pTable->Keys = {szName};
    }
  }
  if (!pTable->blHasRowid) {
    Statement Info(Db, "SELECT name FROM pragma_table_xinfo(?, 'main') WHERE pk ORDER BY pk");
    Info.Bind(1, pTable->strName);
    while (Info.Step()) {
      pTable->Keys.push_back(Info.Text(0));
    }
  }
}

// SQL: the keys and columns of the table strAlias, in the order that TableRow expects.
std::string Selected(const TableInfo& Table, const std::string& strAlias) {
  std::string strSql;
  for (const std::string& strKey : Table.Keys) {
    strSql += ", " + strAlias + "." + Quoted(strKey);
  }
  for (const ColumnInfo& Column : Table.Columns) {
    strSql += ", " + strAlias + "." + Quoted(Column.strName);
  }
  return strSql.substr(2);
}

std::string SameKeys(const TableInfo& Table) {
  std::string strSql;
  for (const std::string& strKey : Table.Keys) {
    strSql += " AND a." + Quoted(strKey) + " = b." + Quoted(strKey);
  }
  return strSql.substr(5);
}

// Keys are never NULL. If the key of the joined row is NULL, there is no such row.
void CompareKept(const Database& Db, const TableInfo& Table, ChangeSink* pSink) {
  const std::string strName = Quoted(Table.strName);
  Statement Rows(Db, "SELECT " + Selected(Table, "b") + ", " + Selected(Table, "a") +
                         " FROM main." + strName + " AS b NOT INDEXED LEFT JOIN after." + strName +
                         " AS a ON " + SameKeys(Table));
  const TableRow Before(Table, Rows.Get(), 0);
  const TableRow After(Table, Rows.Get(),
                       static_cast<int>(Table.Keys.size() + Table.Columns.size()));
  while (Rows.Step()) {
    if (sqlite3_value_type(After.Key(0)) == SQLITE_NULL) {
      pSink->Removed(Before);
      continue;
    }
    for (size_t Column = 0; Column < Table.Columns.size(); ++Column) {
      if (!IsSame(Before.Column(Column), After.Column(Column))) {
        pSink->Cell(Before, After, Column);
      }
    }
  }
}

void CompareAdded(const Database& Db, const TableInfo& Table, ChangeSink* pSink) {
  const std::string strName = Quoted(Table.strName);
  Statement Rows(Db, "SELECT " + Selected(Table, "a") + " FROM after." + strName +
                         " AS a NOT INDEXED WHERE NOT EXISTS (SELECT 1 FROM main." + strName +
                         " AS b WHERE " + SameKeys(Table) + ")");
  const TableRow After(Table, Rows.Get(), 0);
  while (Rows.Step()) {
    pSink->Added(After);
  }
}

void CompareTable(const Database& Db, const ListedTable& Listed, ChangeSink* pSink) {
  TableInfo Table;
  Table.strName = Listed.strName;
  Table.blHasRowid = Listed.blHasRowid;
  try {
    ReadColumns(Db, &Table);
    ReadKeys(Db, &Table);
    if (Table.Keys.empty()) {
      pSink->NotCompared(Table.strName, "columns hide every name of its rowid");
      return;
    }
    CompareKept(Db, Table, pSink);
    CompareAdded(Db, Table, pSink);
  } catch (const SqlFailure& Reason) {
    // The table uses a collation or a function that only the recorder has.
    if (Reason.Code() != SQLITE_ERROR) {
      throw;
    }
    pSink->NotCompared(Table.strName, Reason.what());
  }
}

}  // namespace

void Compare(const Database& Db, ChangeSink* pSink, ChangeSink* pBookkeeping) {
  for (const ListedTable& Listed : ListTables(Db)) {
    if (Listed.strType == "view" || Listed.strType == "virtual") {
      pSink->NotCompared(Listed.strName, Listed.strType == "view" ? "view" : "virtual table");
    } else if (Listed.strName != "sqlite_sequence") {
      CompareTable(Db, Listed, pSink);
    } else if (pBookkeeping != nullptr) {
      CompareTable(Db, Listed, pBookkeeping);
    }
  }
}

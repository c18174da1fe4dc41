#include "references.h"

namespace {

constexpr const char* LISTS = R"(
  CREATE TEMP TABLE broken_before (child, row, parent, id, count);
  CREATE TEMP TABLE broken_now (child, row, parent, id, count))";

// What led nowhere before the upgrade may do so again.
constexpr const char* NEWLY_BROKEN = R"(
  SELECT child, row, parent, id FROM temp.broken_now AS n WHERE NOT EXISTS (
    SELECT 1 FROM (SELECT * FROM temp.broken_before UNION ALL SELECT * FROM changes.dangling) AS b
    WHERE b.child = n.child AND b.row IS n.row AND b.parent = n.parent AND b.id = n.id
      AND b.count >= n.count))";

// There is no row to leave for a reference: it may lead nowhere, however often.
constexpr const char* ACCEPT = R"(
  INSERT INTO temp.broken_before
  VALUES (?, CAST(nullif(?, '') AS INTEGER), ?, ?, 9223372036854775807))";

// A foreign key without column names leads to the primary key.
constexpr const char* COLUMNS = R"(
  SELECT "from", coalesce("to", (SELECT name FROM pragma_table_info(f."table") WHERE pk = seq + 1))
  FROM pragma_foreign_key_list(?) AS f WHERE id = ? ORDER BY seq)";

// Rows that have come back and refer to nothing.
constexpr const char* CHILDREN = R"(
  SELECT x.rowid FROM temp.row_{n} AS x JOIN main.{child} AS c ON {c_is_x}
  WHERE {goes_back} AND x.kind <> 'added' AND {is_row} AND {refers} AND NOT EXISTS (
    SELECT 1 FROM main.{parent} AS p WHERE {leads}))";

// Rows that would go, or lose the value that another row c refers to.
constexpr const char* PARENTS = R"(
  SELECT x.rowid FROM temp.row_{n} AS x JOIN main.{parent} AS p ON {p_is_x}
    JOIN main.{child} AS c ON {leads}
    LEFT JOIN changes.before_{n} AS b USING ({keys})
    LEFT JOIN changes.after_{n} AS a USING ({keys})
  WHERE {goes_back} AND {is_row} AND (x.kind = 'added' OR {moves}))";

}  // namespace

// The words of a pattern for the table that x is a row of: {leads} is true if the row p is the one
// that the row c refers to, and {moves} if the upgrade has changed the value that it refers to.
WordMap References::Describe(const ChangedTable& Table, const BrokenReference& Reference) const {
  std::string strLeads = "1";
  std::string strRefers = "1";
  std::string strMoves = "0";
  Statement Columns(m_Db, COLUMNS);
  Columns.Bind(1, Reference.strChild);
  Columns.Bind(2, Reference.Id);
  while (Columns.Step()) {
    const std::string strColumn = "c." + Quoted(Columns.Text(0));
    strRefers += " AND " + strColumn + " IS NOT NULL";
    strLeads += " AND p." + Quoted(Columns.Text(1)) + " = " + strColumn;
    const std::string strIdx = std::to_string(FindName(Table.Columns, Columns.Text(1)));
    strMoves += strIdx == "-1" ? "" : " OR NOT (" + SameValue("a.c" + strIdx, "b.c" + strIdx) + ")";
  }
  return {{"n", std::to_string(Table.Number)},
          {"goes_back", GOES_BACK},
          {"child", Quoted(Reference.strChild)},
          {"parent", Quoted(Reference.strParent)},
          {"is_row", Reference.strRow.empty() ? "1" : "c.rowid = " + Reference.strRow},
          {"c_is_x", SameKeys(Table, "c", "x.k{i}")},
          {"p_is_x", SameKeys(Table, "p", "x.k{i}")},
          {"keys", Numbered("k", Table.Keys)},
          {"leads", strLeads},
          {"refers", strRefers},
          {"moves", strMoves}};
}

// Appends the rows of the table strTable that the pattern finds. Returns false if there are none.
bool References::Find(const std::string& strTable, const char* szPattern,
                      const BrokenReference& Reference, const std::string& strReason,
                      std::vector<LeftRow>* pLeft) const {
  const size_t Known = pLeft->size();
  for (const TableUndo& Undo : m_Tables) {
    if (Undo.CanGoBack() && FindName({strTable}, Undo.Table().strName) == 0) {
      Statement Rows(m_Db, Fill(szPattern, Describe(Undo.Table(), Reference)));
      while (Rows.Step()) {
        pLeft->push_back({Undo.Table().Number, Rows.Int(0), strReason});
      }
    }
  }
  return pLeft->size() > Known;
}

References::References(const Database& Db, const std::vector<TableUndo>& Tables)
    : m_Db(Db), m_Tables(Tables) {
  m_Db.Execute(LISTS);
  ListDangling(m_Db, "main", "temp.broken_before");
}

std::vector<BrokenReference> References::Check(std::vector<LeftRow>* pLeft) const {
  ListDangling(m_Db, "main", "temp.broken_now");
  std::vector<BrokenReference> Missed;
  Statement New(m_Db, NEWLY_BROKEN);
  while (New.Step()) {
    const BrokenReference Reference = {New.Text(0), New.Text(1), New.Text(2), New.Int(3)};
    const std::string strReason = "it refers to a row of " + Reference.strParent + " that is gone";
    if (!Find(Reference.strChild, CHILDREN, Reference, strReason, pLeft)) {
      Missed.push_back(Reference);
    }
  }
  return Missed;
}

void References::FindParents(const std::vector<BrokenReference>& Broken,
                             std::vector<LeftRow>* pLeft) const {
  for (const BrokenReference& Reference : Broken) {
    const std::string strReason = "a row of " + Reference.strChild + " refers to it";
    if (!Find(Reference.strParent, PARENTS, Reference, strReason, pLeft)) {
      m_Db.Run(ACCEPT, Reference.strChild, Reference.strRow, Reference.strParent, Reference.Id);
    }
  }
}

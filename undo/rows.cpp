#include "rows.h"

#include <cinttypes>
#include <cstdio>

#include "value.h"

namespace {

// In all patterns, t is the row of the table, b and a are the row before and after the upgrade, and
// x is the row of row_N.

// {counts} adds up four counts in one number, and the rest takes them apart: changes to set back,
// as before already and changed since, and other columns that have been changed since. A part of a
// row may be as before, because an upgrade can be killed.
constexpr const char* LIST = R"(
  CREATE TEMP TABLE row_{n} AS
  WITH counted AS MATERIALIZED (  -- so that each count is made once
    SELECT {x_keys}, {present} AS present, {counts} AS n, {same_camera} AS same_camera,
      CASE WHEN b.k0 IS NULL THEN 'added' WHEN a.k0 IS NULL THEN 'removed' ELSE 'changed' END
        AS kind,
      iif(a.k0 IS NULL, {old_rowid}, {rowid}) AS r
    FROM (SELECT {keys} FROM changes.before_{n} UNION SELECT {keys} FROM changes.after_{n}) AS x
      LEFT JOIN changes.before_{n} AS b USING ({keys})
      LEFT JOIN changes.after_{n} AS a USING ({keys}) LEFT JOIN main.{table} AS t ON {t_is_x}),
  judged AS (
    SELECT *,
      CASE kind WHEN 'changed' THEN n % 1024 WHEN 'added' THEN present AND n < 1024
        ELSE NOT present END AS back,
      CASE kind WHEN 'changed' THEN n / 1024 % 1024 WHEN 'added' THEN NOT present
        ELSE present AND n % 1024 = 0 AND n < 1048576 END AS done
    FROM counted)
  SELECT {keys}, kind, back, done,
    iif(kind = 'changed', n / 1048576 % 1024, 1 - back - done) AS lost, n < 1048576 AS whole, r,
    CASE
      WHEN kind = 'changed' AND NOT present THEN 'the row is gone'
      WHEN kind = 'changed' AND NOT same_camera THEN 'it is another camera now'
      WHEN kind = 'removed' AND back + done = 0 THEN 'another row has its key'
      WHEN kind = 'added' AND back + done = 0 THEN 'the row has been changed since'
      WHEN kind = 'changed' AND n >= 1048576 AND NOT {is_camera}
        THEN 'the row has been changed since'
    END AS reason
  FROM judged)";

constexpr const char* COUNT_CELL = R"(
  CASE WHEN {unchanged} THEN CASE WHEN {as_after} THEN 0 ELSE 1073741824 END
    WHEN NOT {present} THEN 1048576
    WHEN {as_after} THEN 1 WHEN {as_before} THEN 1024 ELSE 1048576 END)";

// The rows to insert. What somebody has changed since stays.
constexpr const char* MERGE = R"(
  CREATE TEMP TABLE merged_{n} AS SELECT x.r, x.kind = 'removed' AS removed, {merged}
  FROM temp.row_{n} AS x CROSS JOIN changes.before_{n} AS b USING ({keys})
    LEFT JOIN changes.after_{n} AS a USING ({keys}) LEFT JOIN main.{table} AS t ON {t_is_x}
  WHERE {goes_back} AND x.kind <> 'added')";

constexpr const char* MERGE_CELL = R"(
  CASE WHEN x.whole OR (NOT ({unchanged}) AND {as_after}) THEN b.c{i} ELSE t.{name} END AS c{i})";

constexpr const char* DELETE = R"(
  DELETE FROM main.{table} WHERE ({collated_keys}) IN (
    SELECT {keys} FROM temp.row_{n} AS x WHERE {goes_back} AND x.kind <> 'removed'))";

// The table's own answers to a conflict, such as REPLACE, do not count here. A changed row comes
// before the removed ones, so that it keeps its rowid.
constexpr const char* INSERT_MERGED = R"(
  INSERT OR IGNORE INTO main.{table} ({columns})
  SELECT {values} FROM temp.merged_{n} ORDER BY removed, rowid)";

constexpr const char* FORGET_ROWIDS = "UPDATE temp.merged_{n} SET r = NULL";

constexpr const char* REFUSED = R"(
  SELECT x.rowid FROM temp.row_{n} AS x
  WHERE {goes_back} AND x.kind <> 'added'
    AND NOT EXISTS (SELECT 1 FROM main.{table} AS t WHERE {t_is_x}))";

constexpr const char* SUMS = R"(
  SELECT total(back) FILTER (WHERE reason IS NULL),
    total(lost) + total(back) FILTER (WHERE reason IS NOT NULL), total(done) FROM temp.row_{n})";

// Of a changed row that is there, the cells that are as before are not left.
constexpr const char* LEFT_CELL = R"(
  ({text}, b.c{i}, a.c{i}, t.{name}, NOT (x.kind = 'changed'
    AND (({unchanged}) OR (x.back + x.done > 0 AND {as_before})))))";

constexpr const char* LEFT = R"(
  SELECT 'left: ' || {name} || {camera_name} || ' ' || x.kind || (
      WITH cell (name, before, after, now, named) AS (VALUES {cells})
      SELECT ': before ' || iif(x.kind = 'added', 'none', {list_before})
        || '; after ' || iif(x.kind = 'removed', 'none', {list_after})
        || '; now ' || iif({present}, {list_now}, 'none') FROM cell WHERE named)
    || ' (' || shown_name(coalesce(x.reason, 'it has been changed since')) || ')'
  FROM temp.row_{n} AS x LEFT JOIN changes.before_{n} AS b USING ({keys})
    LEFT JOIN changes.after_{n} AS a USING ({keys}) LEFT JOIN main.{table} AS t ON {t_is_x}
  WHERE x.lost > 0 OR (x.back > 0 AND x.reason IS NOT NULL)
  ORDER BY x.kind <> 'changed', x.kind, x.rowid)";

constexpr const char* ROWS = R"(
  SELECT count(*) FROM (SELECT {keys} FROM changes.before_{n} UNION
                        SELECT {keys} FROM changes.after_{n}))";

// In "camera", the same vendor and model make it the same row.
std::string SameCamera(const ChangedTable& Table) {
  const auto Same = [&](int Column) {
    const std::string strNow = "t." + Quoted(Table.Columns[static_cast<size_t>(Column)]);
    const std::string strIdx = std::to_string(Column);
    return "(" + SameValue(strNow, "a.c" + strIdx) + " OR " + SameValue(strNow, "b.c" + strIdx) +
           ")";
  };
  return Table.IsCamera() ? Same(Table.Vendor) + " AND " + Same(Table.Model) : "1";
}

// True if the rows have a rowid that no column holds.
bool HasOwnRowid(const ChangedTable& Table) {
  return !Table.strRowid.empty() && FindName(Table.Columns, Table.strRowid) == -1;
}

WordMap MakeWords(const ChangedTable& Table) {
  const std::vector<std::string>& Columns = Table.Columns;
  const bool blRowid = HasOwnRowid(Table);
  const std::string strRowid = blRowid ? Quoted(Table.strRowid) : "";
  const std::string strPresent = "(t." + Quoted(Table.Keys[0]) + " IS NOT NULL)";
  const WordMap Cell = {
      {"unchanged", SameValue("a.c{i}", "b.c{i}")},
      {"as_after", SameValue("t.{name}", "a.c{i}")},
      {"as_before", SameValue("t.{name}", "b.c{i}")},
      {"present", "{present}"},
      {"i", "{i}"},
      {"name", "{name}"},
      {"text", "{text}"},
  };
  const auto EachCell = [&](const char* szPattern, const char* szBetween) {
    return ForEach(Columns, Fill(szPattern, Cell), szBetween, {{"present", strPresent}});
  };
  const auto List = [](const std::string& strValue) {
    return "group_concat(shown_name(name) || '=' || shown(" + strValue + "), ', ')";
  };
  return {
      {"n", std::to_string(Table.Number)},
      {"table", Quoted(Table.strName)},
      {"goes_back", GOES_BACK},
      {"present", strPresent},
      {"is_camera", Table.IsCamera() ? "1" : "0"},
      {"same_camera", SameCamera(Table)},
      {"keys", Numbered("k", Table.Keys)},
      {"x_keys", Numbered("x.k", Table.Keys)},
      {"collated_keys", ForEachKey(Table, "{name} COLLATE {collation}", ", ")},
      {"t_is_x", SameKeys(Table, "t", "x.k{i}")},
      {"name", RowName(Table, "x.k{i}")},
      {"camera_name", CameraName(Table, "iif(x.kind = 'removed', b.c{i}, a.c{i})")},
      {"counts", EachCell(COUNT_CELL, " + ")},
      {"merged", EachCell(MERGE_CELL, ", ")},
      {"cells", EachCell(LEFT_CELL, ", ")},
      {"list_before", List("before")},
      {"list_after", List("after")},
      {"list_now", List("now")},
      {"rowid", blRowid ? "t." + strRowid : "0"},
      {"old_rowid", Table.blRowidOnly ? "x.k0"
                    : blRowid         ? "b.r"
                                      : "0"},
      {"columns", (blRowid ? strRowid + ", " : "") + ForEach(Columns, "{name}", ", ")},
      {"values", (blRowid ? "r, " : "") + Numbered("c", Columns)},
  };
}

}  // namespace

TableUndo::TableUndo(const Database& Db, const ChangedTable& Table, bool blRebuilt)
    : m_Db(Db), m_Table(Table), m_Words(MakeWords(Table)), m_strReason(FindReason(blRebuilt)) {}

std::string TableUndo::FindReason(bool blRebuilt) const {
  Statement Definition(m_Db,
                       "SELECT sql FROM main.sqlite_schema WHERE name = ? AND type = 'table'");
  Definition.Bind(1, m_Table.strName);
  if (!Definition.Step() || Definition.Text(0) != m_Table.strDefinition) {
    return "its definition has been changed since";
  }
  if (blRebuilt && m_Table.blRowidOnly) {
    return "its rows may have been renumbered since";
  }
  try {
    const Statement Delete(m_Db, Fill("DELETE FROM main.{table}", m_Words));
    const Statement Insert(m_Db, Fill("INSERT INTO main.{table} DEFAULT VALUES", m_Words));
    return "";
  } catch (const SqlFailure& Reason) {
    return Reason.what();  // such as an index with a function that only the recorder has
  }
}

void TableUndo::Classify() const {
  if (CanGoBack()) {
    Execute(LIST);
  }
}

void TableUndo::Leave(const std::vector<LeftRow>& Left) const {
  for (const LeftRow& Row : Left) {
    if (Row.Number == m_Table.Number) {
      m_Db.Run(Fill("UPDATE temp.row_{n} SET reason = ? WHERE rowid = ?", m_Words), Row.strReason,
               Row.Row);
    }
  }
}

void TableUndo::Apply(std::vector<LeftRow>* pLeft) const {
  if (!CanGoBack()) {
    return;
  }
  Execute(MERGE);
  Execute(DELETE);
  Execute(INSERT_MERGED);
  if (HasOwnRowid(m_Table) && !m_Table.blRowidOnly) {
    // A removed row gets another rowid if its own has been given to another row. The rows that are
    // there already are ignored.
    Execute(FORGET_ROWIDS);
    Execute(INSERT_MERGED);
  }
  Statement Refused(m_Db, Fill(REFUSED, m_Words));
  while (Refused.Step()) {
    pLeft->push_back({m_Table.Number, Refused.Int(0), "UNIQUE, CHECK or NOT NULL forbids it now"});
  }
}

// --- What is left ---

void TableUndo::Print(Counts* pCounts) const {
  if (!CanGoBack()) {
    Statement Rows(m_Db, Fill(ROWS, m_Words));
    if (Rows.Step() && Rows.Int(0) > 0) {
      printf("left: %s: %" PRId64 " rows (%s)\n", Name(m_Table.strName).c_str(), Rows.Int(0),
             Name(m_strReason).c_str());
      pCounts->Left += Rows.Int(0);
    }
    return;
  }
  Statement Sums(m_Db, Fill(SUMS, m_Words));
  Sums.Step();
  pCounts->Back += Sums.Int(0);
  pCounts->Left += Sums.Int(1);
  pCounts->Done += Sums.Int(2);
  Statement Left(m_Db, Fill(LEFT, m_Words));
  while (Left.Step()) {
    puts(Left.Text(0).c_str());
  }
}

#include "report.h"

#include <cstdio>

#include "sqltext.h"
#include "value.h"

namespace {

// In all patterns, b is a row before the upgrade and a the same one after it, or b is a row of one
// of both states. {i} is the place of a column, {text} its name.

// For each row its name, and for each column a line if its cell has changed, else NULL.
constexpr const char* CELLS = R"(
  SELECT {name} || {camera_name}, {lines}
  FROM before_{n} AS b JOIN after_{n} AS a ON {same_keys} ORDER BY {keys})";

constexpr const char* TEXT_CELL =
    "' ' || shown_name({text}) || ': ' || shown(b.c{i}) || ' -> ' || shown(a.c{i})";

constexpr const char* JSON_CELL = R"(
  json_object('change', 'cell', {row} {camera}, 'column', value_json({text}),
    'before', value_json(b.c{i}), 'after', value_json(a.c{i})))";

constexpr const char* JSON_CAMERA =
    ", 'vendor', value_json(b.c{vendor}), 'model', value_json(b.c{model})";

// For each row of one state that the other lacks its name, and one line.
constexpr const char* ROWS = R"(
  SELECT {name}, {line} FROM {in}_{n} AS b
  WHERE NOT EXISTS (SELECT 1 FROM {not_in}_{n} AS a WHERE {same_keys}) ORDER BY {keys})";

constexpr const char* TEXT_ROW = R"(
  ' {what}: ' || (WITH field (name, value) AS (VALUES {fields})
    SELECT group_concat(shown_name(name) || '=' || shown(value), ', ') FROM field))";

constexpr const char* JSON_ROW = R"(
  json_object('change', '{what}', {row}, 'values', (WITH field (name, value) AS (VALUES {fields})
    SELECT json_group_object(shown_name(name), value_json(value)) FROM field)))";

constexpr const char* JSON_NOT_COMPARED = R"(
  SELECT json_object('change', 'not compared', 'table', value_json(?), 'reason', value_json(?)))";

constexpr const char* JSON_FILE =
    "SELECT json_object('change', 'file', 'name', value_json(?), 'diff', value_json(?))";

constexpr const char* JSON_FAILED = R"(
  SELECT json_object('change', 'failed', 'action', value_json(?), 'reason', value_json(?),
    'enough', value_json(?)))";

constexpr const char* TEXT_SUMMARY =
    "{cells} cells in {cameras} cameras, {others} other cells, {added} rows added, "
    "{removed} rows removed, ";

constexpr const char* JSON_SUMMARY = R"(
  SELECT json_object('change', 'summary', 'camera_cells', {cells}, 'cameras', {cameras},
    'other_cells', {others}, 'rows_added', {added}, 'rows_removed', {removed}, 'files', {files},
    'actions_failed', {failed}, 'status', {status}))";

// The members "table" and "row": the value of the key, or an array if it has several columns.
std::string JsonRow(const ChangedTable& Table) {
  const std::string strKeys = ForEach(Table.Keys, "value_json(b.k{i})", ", ");
  return "'table', value_json(" + Literal(Table.strName) + "), 'row', " +
         (Table.Keys.size() == 1 ? strKeys : "json_array(" + strKeys + ")");
}

WordMap MakeWords(const ChangedTable& Table, OutputMode Mode) {
  const bool blText = Mode == OutputMode::TEXT;  // an object names its row itself
  return {{"n", std::to_string(Table.Number)},
          {"name", blText ? RowName(Table, "b.k{i}") : "''"},
          {"camera_name", blText ? CameraName(Table, "b.c{i}") : "''"},
          {"row", JsonRow(Table)},
          {"camera", Table.IsCamera() ? Fill(JSON_CAMERA, {{"vendor", std::to_string(Table.Vendor)},
                                                           {"model", std::to_string(Table.Model)}})
                                      : ""},
          {"keys", Numbered("b.k", Table.Keys)},
          {"same_keys", ForEach(Table.Keys, "a.k{i} = b.k{i}", " AND ")},
          {"fields", ForEach(Table.Columns, "({text}, b.c{i})", ", ")}};
}

void Print(const std::string& strText) { fwrite(strText.data(), 1, strText.size(), stdout); }

}  // namespace

Report::Report(const Database& Changes, OutputMode Mode, bool blCaps)
    : m_Changes(Changes), m_Mode(Mode) {
  m_Counts.Files = blCaps ? 0 : -1;
  AddPrintFunctions(Changes);
}

// Runs a statement that selects the names of rows, and then lines or NULLs. Prints the lines, and
// counts them and the rows.
int64_t Report::PrintLines(const std::string& strSql, int64_t* pRows) const {
  Statement Row(m_Changes, strSql);
  int64_t Lines = 0;
  for (; Row.Step(); ++*pRows) {
    for (int Line = 1; Line < sqlite3_column_count(Row.Get()); ++Line) {
      if (sqlite3_value_type(Row.Value(Line)) == SQLITE_NULL) {
        continue;
      }
      ++Lines;
      if (m_Mode == OutputMode::TEXT || m_Mode == OutputMode::JSON) {
        Print(Row.Text(0) + Row.Text(Line) + "\n");
      }
    }
  }
  return Lines;
}

void Report::Table(const ChangedTable& Table) {
  if (!Table.strReason.empty()) {
    NotCompared(Table);
    return;
  }
  const bool blJson = m_Mode == OutputMode::JSON;
  WordMap Words = MakeWords(Table, m_Mode);
  const std::string strCell = "CASE WHEN NOT (" + SameValue("a.c{i}", "b.c{i}") + ") THEN " +
                              (blJson ? JSON_CELL : TEXT_CELL) + " END";
  Words["lines"] = ForEach(Table.Columns, strCell, ", ", Words);
  int64_t Rows = 0;
  const int64_t Cells = PrintLines(Fill(CELLS, Words), &Rows);
  (Table.IsCamera() ? m_Counts.CameraCells : m_Counts.OtherCells) += Cells;
  m_Counts.Cameras += Table.IsCamera() ? Rows : 0;

  const auto PrintRows = [&](const char* szWhat, const char* szIn, const char* szNotIn) {
    Words["what"] = szWhat;
    Words["line"] = Fill(blJson ? JSON_ROW : TEXT_ROW, Words);
    Words["in"] = szIn;
    Words["not_in"] = szNotIn;
    return PrintLines(Fill(ROWS, Words), &Rows);
  };
  m_Counts.Removed += PrintRows("removed", "before", "after");
  m_Counts.Added += PrintRows("added", "after", "before");
}

void Report::NotCompared(const ChangedTable& Table) const {
  if (Table.strName.compare(0, 7, "sqlite_") == 0 && !Table.blDoubt) {
    return;  // SQLite's own bookkeeping
  }
  if (m_Mode == OutputMode::JSON) {
    Print(m_Changes.Run(JSON_NOT_COMPARED, Table.strName, Table.strReason) + "\n");
    return;
  }
  // --check has no output, but what it did not look at must be known.
  fprintf(m_Mode == OutputMode::CHECK ? stderr : stdout, "not compared: %s (%s)\n",
          Name(Table.strName).c_str(), Name(Table.strReason).c_str());
}

void Report::File(const std::string& strName, const std::string& strDiff) {
  ++m_Counts.Files;
  if (m_Mode == OutputMode::JSON) {
    Print(m_Changes.Run(JSON_FILE, strName, strDiff) + "\n");
  } else if (m_Mode == OutputMode::TEXT) {
    Print(strDiff);
  }
}

void Report::Failed(const FailedAction& Failed, const std::string& strCause) const {
  if (m_Mode == OutputMode::JSON) {
    Print(m_Changes.Run(JSON_FAILED, Failed.strName, Failed.strReason, strCause) + "\n");
  } else if (m_Mode == OutputMode::TEXT) {
    const std::string strEnough = strCause.empty() ? "" : " (" + strCause + " alone is enough)";
    Print("failed: " + Name(Failed.strName) + ": " + Name(Failed.strReason) + strEnough + "\n");
  }
}

void Report::Summary(int Status) const {
  const Counts& All = m_Counts;
  const WordMap Words = {{"cells", std::to_string(All.CameraCells)},
                         {"cameras", std::to_string(All.Cameras)},
                         {"others", std::to_string(All.OtherCells)},
                         {"added", std::to_string(All.Added)},
                         {"removed", std::to_string(All.Removed)},
                         {"files", All.Files == -1 ? "NULL" : std::to_string(All.Files)},
                         {"failed", std::to_string(All.Failed)},
                         {"status", std::to_string(Status)}};
  if (m_Mode == OutputMode::JSON) {
    Print(m_Changes.Run(Fill(JSON_SUMMARY, Words)) + "\n");
  } else if (m_Mode != OutputMode::CHECK) {
    Print(
        Fill(TEXT_SUMMARY, Words) +
        Fill(All.Files == -1 ? "capability files not looked at" : "{files} files changed", Words) +
        Fill(", {failed} actions failed\n", Words));
  }
}

#include "report.h"

#include <cstdio>

#include "sqltext.h"
#include "value.h"

namespace {

// In all patterns, b is a row before the upgrade and a the same one after it, or b is a row of one
// of both states. {i} is the place of a column, {text} its name.

// For each row its keys and columns, and for each column a line if its cell has changed, else NULL.
constexpr const char* CELLS = R"(
  SELECT {keys}, {columns}, {lines} FROM before_{n} AS b JOIN after_{n} AS a ON {same_keys}
  ORDER BY {keys})";

constexpr const char* TEXT_CELL =
    "' ' || shown_name({text}) || ': ' || shown(b.c{i}) || ' -> ' || shown(a.c{i})";

constexpr const char* JSON_CELL = R"(
  json_object('change', 'cell', {row} {camera}, 'column', value_json({text}),
    'before', value_json(b.c{i}), 'after', value_json(a.c{i})))";

constexpr const char* JSON_CAMERA =
    ", 'vendor', value_json(b.c{vendor}), 'model', value_json(b.c{model})";

// For each row of one state that the other lacks its keys, and one line.
constexpr const char* ROWS = R"(
  SELECT {keys}, {line} FROM {in}_{n} AS b
  WHERE NOT EXISTS (SELECT 1 FROM {not_in}_{n} AS a WHERE {same_keys}) ORDER BY {keys})";

constexpr const char* TEXT_ROW = R"(
  ' {what}: ' || (WITH field (name, value) AS (VALUES {fields})
    SELECT group_concat(shown_name(name) || '=' || shown(value), ', ') FROM field))";

constexpr const char* JSON_ROW = R"(
  json_object('change', '{what}', {row}, 'values', (WITH field (name, value) AS (VALUES {fields})
    SELECT json_group_object(name_json(name), value_json(value)) FROM field)))";

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

WordMap MakeWords(const ChangedTable& Table) {
  return {{"n", std::to_string(Table.Number)},
          {"row", JsonRow(Table)},
          {"keys", Numbered("b.k", Table.Keys)},
          {"columns", Numbered("b.c", Table.Columns)},
          {"same_keys", ForEach(Table.Keys, "a.k{i} = b.k{i}", " AND ")},
          {"fields", ForEach(Table.Columns, "({text}, b.c{i})", ", ")}};
}

std::string ShownName(sqlite3_value* pValue) {
  return Name(reinterpret_cast<const char*>(sqlite3_value_text(pValue)));
}

template <std::string (*pFunction)(sqlite3_value*)>
void TextFunction(sqlite3_context* pContext, int /*Count*/, sqlite3_value** ppValues) {
  const std::string strText = pFunction(ppValues[0]);
  sqlite3_result_text64(pContext, strText.data(), strText.size(), SQLITE_TRANSIENT, SQLITE_UTF8);
}

void Print(const std::string& strText) { fwrite(strText.data(), 1, strText.size(), stdout); }

}  // namespace

Report::Report(const Database& Changes, OutputMode Mode, bool blCaps)
    : m_Changes(Changes), m_Mode(Mode) {
  m_Counts.Files = blCaps ? 0 : -1;
  AddJsonFunctions(Changes);
  for (const auto& [szName, pFunction] : {std::pair("shown", TextFunction<Shown>),
                                          std::pair("shown_name", TextFunction<ShownName>)}) {
    sqlite3_create_function(Changes.Get(), szName, 1, SQLITE_UTF8, nullptr, pFunction, nullptr,
                            nullptr);
  }
}

// Runs a statement that selects the keys of rows, perhaps their columns, and then lines or NULLs.
// Prints the lines, and counts them.
int64_t Report::PrintLines(const ChangedTable& Table, const std::string& strSql, bool blColumns,
                           int64_t* pRows) const {
  Statement Row(m_Changes, strSql);
  const auto Columns = static_cast<int>(Table.Keys.size());
  const int FirstLine = Columns + (blColumns ? static_cast<int>(Table.Columns.size()) : 0);
  int64_t Lines = 0;
  for (; Row.Step(); ++*pRows) {
    const std::string strRow =
        m_Mode == OutputMode::TEXT ? RowName(Table, Row, 0, blColumns ? Columns : -1) : "";
    for (int Line = FirstLine; Line < sqlite3_column_count(Row.Get()); ++Line) {
      if (sqlite3_value_type(Row.Value(Line)) == SQLITE_NULL) {
        continue;
      }
      ++Lines;
      if (m_Mode == OutputMode::TEXT || m_Mode == OutputMode::JSON) {
        Print(strRow + Row.Text(Line) + "\n");
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
  const bool blCamera = Table.IsCamera();
  WordMap Words = MakeWords(Table);
  Words["camera"] = blCamera ? Fill(JSON_CAMERA, {{"vendor", std::to_string(Table.Vendor)},
                                                  {"model", std::to_string(Table.Model)}})
                             : "";
  const std::string strCell = "CASE WHEN NOT (" + SameValue("a.c{i}", "b.c{i}") + ") THEN " +
                              (blJson ? JSON_CELL : TEXT_CELL) + " END";
  Words["lines"] = ForEach(Table.Columns, strCell, ", ", Words);
  int64_t Rows = 0;
  const int64_t Cells = PrintLines(Table, Fill(CELLS, Words), true, &Rows);
  (blCamera ? m_Counts.CameraCells : m_Counts.OtherCells) += Cells;
  m_Counts.Cameras += blCamera ? Rows : 0;

  const auto PrintRows = [&](const char* szWhat, const char* szIn, const char* szNotIn) {
    Words["what"] = szWhat;
    Words["line"] = Fill(blJson ? JSON_ROW : TEXT_ROW, Words);
    Words["in"] = szIn;
    Words["not_in"] = szNotIn;
    return PrintLines(Table, Fill(ROWS, Words), false, &Rows);
  };
  m_Counts.Removed += PrintRows("removed", "before", "after");
  m_Counts.Added += PrintRows("added", "after", "before");
}

void Report::NotCompared(const ChangedTable& Table) const {
  if (Table.strName.compare(0, 7, "sqlite_") == 0 && !Table.blDoubt) {
    return;  // SQLite's own bookkeeping
  }
  if (m_Mode == OutputMode::JSON) {
    PrintObject("not compared", {{"table", Table.strName}, {"reason", Table.strReason}});
    return;
  }
  // --check has no output, but what it did not look at must be known.
  fprintf(m_Mode == OutputMode::CHECK ? stderr : stdout, "not compared: %s (%s)\n",
          Name(Table.strName).c_str(), Name(Table.strReason).c_str());
}

// Prints an object with these texts as further members.
void Report::PrintObject(const char* szChange,
                         std::initializer_list<std::pair<const char*, std::string>> Texts) const {
  std::string strMembers;
  for (const auto& [szName, strText] : Texts) {
    strMembers.append(", '").append(szName).append("', value_json(?)");
  }
  Statement Object(m_Changes, "SELECT json_object('change', ?" + strMembers + ")");
  int Parameter = 1;
  Object.Bind(Parameter++, std::string(szChange));
  for (const auto& [szName, strText] : Texts) {
    Object.Bind(Parameter++, strText);
  }
  Object.Step();
  Print(Object.Text(0) + "\n");
}

void Report::File(const std::string& strName, const std::string& strDiff) {
  ++m_Counts.Files;
  if (m_Mode == OutputMode::JSON) {
    PrintObject("file", {{"name", strName}, {"diff", strDiff}});
  } else if (m_Mode == OutputMode::TEXT) {
    Print(strDiff);
  }
}

void Report::Failed(const FailedAction& Failed, const std::string& strCause) const {
  if (m_Mode == OutputMode::JSON) {
    PrintObject("failed",
                {{"action", Failed.strName}, {"reason", Failed.strReason}, {"enough", strCause}});
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
    Print(m_Changes.Text(Fill(JSON_SUMMARY, Words)) + "\n");
  } else if (m_Mode != OutputMode::CHECK) {
    Print(
        Fill(TEXT_SUMMARY, Words) +
        Fill(All.Files == -1 ? "capability files not looked at" : "{files} files changed", Words) +
        Fill(", {failed} actions failed\n", Words));
  }
}

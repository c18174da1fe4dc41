#include "report.h"

#include <cinttypes>
#include <cstdio>

#include "value.h"

namespace {

constexpr const char* RED = "\033[31m";
constexpr const char* GREEN = "\033[32m";
constexpr const char* PLAIN = "\033[0m";

void Print(const std::string& strText) { fwrite(strText.data(), 1, strText.size(), stdout); }

// Escapes control characters in a name of a table, column or file: they would break the line.
std::string Name(const std::string& strName) {
  std::string strShown;
  for (const char Char : strName) {
    const auto Byte = static_cast<unsigned char>(Char);
    strShown += Byte < 0x20 || Byte == 0x7f ? "\\x" + Hex({Char}) : std::string{Char};
  }
  return strShown;
}

// "camera 12". If the primary key has several columns: "TABLE 'a', 2".
std::string RowName(const TableRow& Row) {
  const TableInfo& Table = Row.Table();
  std::string strName = Name(Table.strName) + " ";
  for (size_t Key = 0; Key < Table.Keys.size(); ++Key) {
    strName += (Key == 0 ? "" : ", ") + Shown(Row.Key(Key));
  }
  return strName;
}

bool IsCamera(const TableInfo& Table) { return Table.Vendor != -1 && Table.Model != -1; }

std::string Plain(sqlite3_value* pValue) {
  return sqlite3_value_type(pValue) == SQLITE_TEXT ? Escaped(Bytes(pValue)) : Shown(pValue);
}

// " (VENDOR MODEL)" for a camera.
std::string CameraName(const TableRow& Row) {
  const TableInfo& Table = Row.Table();
  if (!IsCamera(Table)) {
    return "";
  }
  return " (" + Plain(Row.Column(static_cast<size_t>(Table.Vendor))) + " " +
         Plain(Row.Column(static_cast<size_t>(Table.Model))) + ")";
}

}  // namespace

// --- Counts ---

void Tally::Cell(const TableRow& Before, const TableRow& /*After*/, size_t /*Column*/) {
  if (!IsCamera(Before.Table())) {
    ++m_OtherCells;
    return;
  }
  // All changed cells of a row arrive together.
  const int64_t Camera = sqlite3_value_int64(Before.Key(0));
  m_Cameras += m_CameraCells == 0 || Camera != m_LastCamera ? 1 : 0;
  m_LastCamera = Camera;
  ++m_CameraCells;
}

void Tally::Added(const TableRow& /*After*/) { ++m_Added; }

void Tally::Removed(const TableRow& /*Before*/) { ++m_Removed; }

bool Tally::IsEmpty() const {
  return m_CameraCells + m_OtherCells + m_Added + m_Removed == 0 && m_Files <= 0;
}

// --- Summary ---

void SummaryReport::Summary(const Tally& Counts) {
  printf("%" PRId64 " cells in %" PRId64 " cameras, %" PRId64 " other cells, %" PRId64
         " rows added, %" PRId64 " rows removed, ",
         Counts.m_CameraCells, Counts.m_Cameras, Counts.m_OtherCells, Counts.m_Added,
         Counts.m_Removed);
  Print(Counts.m_Files == -1 ? "capability files not looked at"
                             : std::to_string(Counts.m_Files) + " files changed");
  printf(", %" PRId64 " actions failed\n", Counts.m_Failed);
}

// --- Text ---

std::string TextReport::Coloured(const char* szColour, const std::string& strText) const {
  return m_blColour ? szColour + strText + PLAIN : strText;
}

void TextReport::Cell(const TableRow& Before, const TableRow& After, size_t Column) {
  Print(RowName(Before) + CameraName(Before) + " " + Name(Before.Table().Columns[Column].strName) +
        ": " + Coloured(RED, Shown(Before.Column(Column))) + " -> " +
        Coloured(GREEN, Shown(After.Column(Column))) + "\n");
}

void TextReport::PrintRow(const TableRow& Row, const char* szWhat, const char* szColour) const {
  std::string strText = RowName(Row) + " " + szWhat + ":";
  const TableInfo& Table = Row.Table();
  for (size_t Column = 0; Column < Table.Columns.size(); ++Column) {
    strText += (Column == 0 ? " " : ", ") + Name(Table.Columns[Column].strName) + "=" +
               Shown(Row.Column(Column));
  }
  Print(Coloured(szColour, strText) + "\n");
}

void TextReport::Added(const TableRow& After) { PrintRow(After, "added", GREEN); }

void TextReport::Removed(const TableRow& Before) { PrintRow(Before, "removed", RED); }

void TextReport::NotCompared(const std::string& strTable, const std::string& strWhat) {
  Print("not compared: " + Name(strTable) + " (" + strWhat + ")\n");
}

void TextReport::File(const std::string& /*strName*/, const std::string& strDiff) {
  Print(strDiff);
}

void TextReport::Failed(const FailedAction& Failed) {
  Print(Coloured(RED, "failed: " + Name(Failed.strName) + ": " + Name(Failed.strReason)) + "\n");
}

// --- JSON ---

namespace {

std::string JsonMember(const char* szName, const std::string& strJson) {
  return std::string(",\"") + szName + "\":" + strJson;
}

void PrintObject(const char* szChange, const std::string& strMembers) {
  Print(std::string("{\"change\":\"") + szChange + "\"" + strMembers + "}\n");
}

// The name of the table, and the rowid or an array of the primary key's values.
std::string JsonRowName(const TableRow& Row) {
  const TableInfo& Table = Row.Table();
  std::string strKey = Json(Row.Key(0));
  for (size_t Key = 1; Key < Table.Keys.size(); ++Key) {
    strKey += "," + Json(Row.Key(Key));
  }
  return JsonMember("table", JsonText(Table.strName)) +
         JsonMember("row", Table.blHasRowid ? strKey : "[" + strKey + "]");
}

void PrintJsonRow(const TableRow& Row, const char* szChange) {
  const TableInfo& Table = Row.Table();
  std::string strValues;
  for (size_t Column = 0; Column < Table.Columns.size(); ++Column) {
    strValues += (Column == 0 ? "" : ",") + JsonText(Table.Columns[Column].strName) + ":" +
                 Json(Row.Column(Column));
  }
  PrintObject(szChange, JsonRowName(Row) + JsonMember("values", "{" + strValues + "}"));
}

}  // namespace

void JsonReport::Cell(const TableRow& Before, const TableRow& After, size_t Column) {
  const TableInfo& Table = Before.Table();
  std::string strCamera;
  if (IsCamera(Table)) {
    strCamera = JsonMember("vendor", Json(Before.Column(static_cast<size_t>(Table.Vendor)))) +
                JsonMember("model", Json(Before.Column(static_cast<size_t>(Table.Model))));
  }
  PrintObject("cell", JsonRowName(Before) + strCamera +
                          JsonMember("column", JsonText(Table.Columns[Column].strName)) +
                          JsonMember("before", Json(Before.Column(Column))) +
                          JsonMember("after", Json(After.Column(Column))));
}

void JsonReport::Added(const TableRow& After) { PrintJsonRow(After, "added"); }

void JsonReport::Removed(const TableRow& Before) { PrintJsonRow(Before, "removed"); }

void JsonReport::NotCompared(const std::string& strTable, const std::string& strWhat) {
  PrintObject("not compared",
              JsonMember("table", JsonText(strTable)) + JsonMember("reason", JsonText(strWhat)));
}

void JsonReport::File(const std::string& strName, const std::string& strDiff) {
  PrintObject("file",
              JsonMember("name", JsonText(strName)) + JsonMember("diff", JsonText(strDiff)));
}

void JsonReport::Failed(const FailedAction& Failed) {
  PrintObject("failed", JsonMember("action", JsonText(Failed.strName)) +
                            JsonMember("reason", JsonText(Failed.strReason)));
}

void JsonReport::Summary(const Tally& Counts) {
  const auto Number = [](int64_t Value) { return std::to_string(Value); };
  PrintObject("summary",
              JsonMember("camera_cells", Number(Counts.m_CameraCells)) +
                  JsonMember("cameras", Number(Counts.m_Cameras)) +
                  JsonMember("other_cells", Number(Counts.m_OtherCells)) +
                  JsonMember("rows_added", Number(Counts.m_Added)) +
                  JsonMember("rows_removed", Number(Counts.m_Removed)) +
                  JsonMember("files", Counts.m_Files == -1 ? "null" : Number(Counts.m_Files)) +
                  JsonMember("actions_failed", Number(Counts.m_Failed)) +
                  JsonMember("status", Number(Counts.m_Status)));
}

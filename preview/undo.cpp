#include "undo.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "failure.h"
#include "files.h"
#include "value.h"

namespace {

// The script disables triggers and foreign keys. They acted during the upgrade already, and it sets
// back the cells that they changed, too.
constexpr const char* BEGIN_SQL =
    "--\n"
    "--     sqlite3 system.db <system.db.sql\n"
    "--\n"
    "-- A cell or row that somebody else has changed since stays as it is.\n"
    ".bail on\n"
    ".timeout 5000\n"
    ".output /dev/null\n"
    ".dbconfig enable_trigger off\n"
    ".output\n"
    "PRAGMA foreign_keys = OFF;\n"
    "PRAGMA ignore_check_constraints = ON;\n"
    "BEGIN IMMEDIATE;\n"
    "-- state: 1 set back, 0 as before the upgrade already, NULL changed since\n"
    "CREATE TEMP TABLE tessel_undo (state);\n";

bool IsBookkeeping(const TableInfo& Table) { return Table.strName == "sqlite_sequence"; }

std::string UndoTable(size_t Idx) { return "tessel_undo_" + std::to_string(Idx); }

// SQL: true if the column has this value and type.
std::string Holds(const std::string& strColumn, const std::string& strValue) {
  return strColumn + " IS " + strValue + " COLLATE BINARY AND typeof(" + strColumn + ") = typeof(" +
         strValue + ")";
}

std::string HasKeys(const TableRow& Row) {
  std::string strSql;
  for (size_t Key = 0; Key < Row.Table().Keys.size(); ++Key) {
    strSql += (Key == 0 ? "" : " AND ") + Quoted(Row.Table().Keys[Key]) + " = " +
              SqlLiteral(Row.Key(Key));
  }
  return strSql;
}

// SQL: true if a row with these keys has all values of Row.
std::string HasRow(const TableRow& Row) {
  std::string strSql = HasKeys(Row);
  for (size_t Column = 0; Column < Row.Table().Columns.size(); ++Column) {
    if (!Row.Table().Columns[Column].blGenerated) {
      strSql += " AND " +
                Holds(Quoted(Row.Table().Columns[Column].strName), SqlLiteral(Row.Column(Column)));
    }
  }
  return strSql;
}

std::string Exists(const TableRow& Row, const std::string& strCondition) {
  return "EXISTS (SELECT 1 FROM main." + Quoted(Row.Table().strName) + " WHERE " + strCondition +
         ")";
}

}  // namespace

UndoScript::UndoScript(const std::string& strFile, const std::string& strVersion)
    : m_strFile(strFile), m_pFile(fopen(strFile.c_str(), "wxe"), fclose) {
  if (m_pFile == nullptr) {
    throw SystemFailure("cannot create " + strFile);
  }
  Write("-- Takes back what tesselupgrader " + strVersion + " has changed:\n" + BEGIN_SQL);
}

void UndoScript::Write(const std::string& strText) {
  fwrite(strText.data(), 1, strText.size(), m_pFile.get());
}

void UndoScript::Cell(const TableRow& Before, const TableRow& After, size_t Column) {
  const TableInfo& Table = Before.Table();
  if (Table.Columns[Column].blGenerated) {
    return;
  }
  if (m_Tables.empty() || m_Tables.back().strName != Table.strName) {
    m_Tables.push_back(Table);
    m_Columns.emplace_back(Table.Columns.size(), false);
    std::string strKeys;
    for (size_t Key = 0; Key < Table.Keys.size(); ++Key) {
      strKeys += ", key" + std::to_string(Key);
    }
    Write("CREATE TEMP TABLE " + UndoTable(m_Tables.size() - 1) + " (col, old, new, state" +
          strKeys + ");\n");
  }
  m_Columns.back()[Column] = true;
  std::string strValues = std::to_string(Column) + ", " + SqlLiteral(Before.Column(Column)) + ", " +
                          SqlLiteral(After.Column(Column)) + ", NULL";
  for (size_t Key = 0; Key < Table.Keys.size(); ++Key) {
    strValues += ", " + SqlLiteral(Before.Key(Key));
  }
  Write("INSERT INTO temp." + UndoTable(m_Tables.size() - 1) + " VALUES (" + strValues + ");\n");
}

// strDone is SQL. It is true if the row is as before the upgrade already.
void UndoScript::WriteState(const TableRow& Row, const std::string& strDone) {
  if (!IsBookkeeping(Row.Table())) {
    Write("INSERT INTO temp.tessel_undo SELECT CASE WHEN changes() THEN 1 WHEN " + strDone +
          " THEN 0 END;\n");
  }
}

void UndoScript::Added(const TableRow& After) {
  Write("DELETE FROM main." + Quoted(After.Table().strName) + " WHERE " + HasRow(After) + ";\n");
  WriteState(After, "NOT " + Exists(After, HasKeys(After)));
}

void UndoScript::Removed(const TableRow& Before) {
  const TableInfo& Table = Before.Table();
  std::string strColumns;
  std::string strValues;
  if (Table.blHasRowid) {
    strColumns = ", " + Quoted(Table.Keys[0]);
    strValues = ", " + SqlLiteral(Before.Key(0));
  }
  for (size_t Column = 0; Column < Table.Columns.size(); ++Column) {
    if (!Table.Columns[Column].blGenerated) {
      strColumns += ", " + Quoted(Table.Columns[Column].strName);
      strValues += ", " + SqlLiteral(Before.Column(Column));
    }
  }
  Write("INSERT INTO main." + Quoted(Table.strName) + " (" + strColumns.substr(2) + ") SELECT " +
        strValues.substr(2) + " WHERE NOT " + Exists(Before, HasKeys(Before)) + ";\n");
  WriteState(Before, Exists(Before, HasRow(Before)));
}

void UndoScript::WriteColumn(size_t Idx, size_t Column) {
  const TableInfo& Table = m_Tables[Idx];
  const std::string strUndo = "temp." + UndoTable(Idx) + " AS u";
  const std::string strTable = "main." + Quoted(Table.strName) + " AS t";
  const std::string strColumn = Quoted(Table.Columns[Column].strName);
  const std::string strHere = "u.col = " + std::to_string(Column);
  std::string strSameRow;
  for (size_t Key = 0; Key < Table.Keys.size(); ++Key) {
    strSameRow +=
        (Key == 0 ? "t." : " AND t.") + Quoted(Table.Keys[Key]) + " = u.key" + std::to_string(Key);
  }
  Write("UPDATE " + strUndo + " SET state = (SELECT CASE\n    WHEN " +
        Holds("t." + strColumn, "u.new") + " THEN 1\n    WHEN " + Holds("t." + strColumn, "u.old") +
        " THEN 0 END\n  FROM " + strTable + " WHERE " + strSameRow + ") WHERE " + strHere + ";\n");
  Write("UPDATE " + strTable + " SET " + strColumn + " = u.old FROM " + strUndo + "\n  WHERE " +
        strHere + " AND u.state = 1 AND " + strSameRow + ";\n");
}

void UndoScript::Close() {
  std::string strStates = "SELECT state FROM temp.tessel_undo";
  for (size_t Idx = 0; Idx < m_Tables.size(); ++Idx) {
    for (size_t Column = 0; Column < m_Columns[Idx].size(); ++Column) {
      if (m_Columns[Idx][Column]) {
        WriteColumn(Idx, Column);
      }
    }
    if (!IsBookkeeping(m_Tables[Idx])) {
      strStates += " UNION ALL SELECT state FROM temp." + UndoTable(Idx);
    }
  }
  Write(
      "COMMIT;\nSELECT printf('%d set back, %d changed since and left, %d already as before',\n"
      "  count(*) FILTER (WHERE state = 1), count(*) FILTER (WHERE state IS NULL),\n"
      "  count(*) FILTER (WHERE state = 0)) FROM (" +
      strStates + ");\n");
  const bool blFailed = ferror(m_pFile.get()) != 0;
  if (fclose(m_pFile.release()) != 0 || blFailed) {
    throw SystemFailure("cannot write " + m_strFile);
  }
}

UndoDirectory::UndoDirectory(const std::string& strDir) : m_strDir(strDir) {
  if (mkdir(strDir.c_str(), 0700) == 0) {
    m_blMade = true;
  } else if (errno != EEXIST) {
    throw SystemFailure("cannot create the directory " + strDir);
  } else if (!ListDirectory(strDir).empty()) {
    throw Failure(strDir + " is not empty");
  }
}

UndoDirectory::~UndoDirectory() {
  if (m_blMade) {
    rmdir(m_strDir.c_str());  // fails if it has files
  }
}

void UndoDirectory::Deliver(const std::string& strFrom, const std::string& strName) {
  const std::string strFile = m_strDir + "/" + strName;
  const Descriptor From(OpenFile(strFrom, O_RDONLY));
  try {
    CopyTo(From.Get(), strFrom, strFile + ".part", 0600);
    SyncFile(strFile + ".part");
    std::filesystem::rename(strFile + ".part", strFile);
    SyncFile(m_strDir);
    SyncFile(std::filesystem::path(m_strDir).parent_path());
  } catch (...) {
    unlink((strFile + ".part").c_str());
    throw;
  }
}

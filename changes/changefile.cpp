#include "changefile.h"

#include <fcntl.h>

#include <algorithm>

#include "fileops.h"
#include "value.h"

namespace {

constexpr const char* APPLICATION_ID = "1414744131";  // "TSLC"
constexpr const char* FORMAT = "1";
// A statement names the keys and columns of a row before, after and now: SQLite allows 2000.
constexpr size_t MAX_COLUMNS = 480;

// Large pages waste little. The file is worthless until it is complete, so nothing is synced.
constexpr const char* SETTINGS =
    "PRAGMA page_size = 32768; PRAGMA journal_mode = MEMORY; PRAGMA synchronous = OFF;"
    "PRAGMA encoding = ";

constexpr const char* TABLES =
    "CREATE TABLE upgrade (version, tool, tool_version, time, database, inode, schema_version);"
    "CREATE TABLE covered (number INTEGER PRIMARY KEY, name, keys, collations, columns, rowid_name,"
    "  rowid_only, definition, reason, doubt);"
    "CREATE TABLE dangling (child, row, parent, id, count);"
    "CREATE TABLE file (name PRIMARY KEY, before, after);"
    "PRAGMA application_id = ";

// If only the recorder has the module of a virtual table (ncol is 0), the tables that hold its
// content are known by their names alone.
constexpr const char* OBJECTS = R"(
  WITH definition AS (
    SELECT 'before' AS side, name, sql FROM before.sqlite_schema WHERE type IN ('table', 'view')
    UNION ALL
    SELECT 'after', name, sql FROM after.sqlite_schema WHERE type IN ('table', 'view'))
  SELECT name, max(wr), max(sql), CASE
      WHEN count(*) = 1 THEN 'exists only ' || side || ' the upgrade'
      WHEN min(sql) IS NOT max(sql) THEN 'the upgrade changes its definition'
    END, CASE
      WHEN type = 'view' THEN type
      WHEN type = 'virtual' THEN 'virtual table'
      WHEN name = 'sqlite_sequence' THEN 'an id is never given out twice'
      WHEN name LIKE 'sqlite\_%' ESCAPE '\' THEN 'belongs to SQLite'
    END, type = 'shadow' OR EXISTS (
      SELECT 1 FROM pragma_table_list AS v WHERE v.type = 'virtual' AND v.ncol = 0
      AND substr(l.name, 1, length(v.name) + 1) = v.name || '_' COLLATE NOCASE)
  FROM definition JOIN pragma_table_list AS l USING (name) WHERE l.schema = side
  GROUP BY name ORDER BY name)";

constexpr const char* DANGLING = R"(
  INSERT INTO {list} SELECT "table", rowid, parent, fkid, count(*)
  FROM pragma_foreign_key_check(?, '{schema}') GROUP BY 1, 2, 3, 4)";

struct Object {
  ChangedTable Table;
  bool blWithoutRowid;
  bool blShadow;  // holds the content of a virtual table
};

// --- What identifies a row ---

std::vector<std::string> Strings(Statement&& Query, const std::string& strParameter) {
  Query.Bind(1, strParameter);
  std::vector<std::string> Result;
  while (Query.Step()) {
    Result.push_back(Query.Text(0));
  }
  return Result;
}

void ReadColumns(const Database& Db, ChangedTable* pTable) {
  std::vector<std::string> All;
  Statement Info(Db, "SELECT name, hidden FROM pragma_table_xinfo(?, 'before')");
  Info.Bind(1, pTable->strName);
  while (Info.Step()) {
    All.push_back(Info.Text(0));
    if (Info.Int(1) == 0) {
      pTable->Columns.push_back(Info.Text(0));
    }
  }
  if (All.size() > MAX_COLUMNS) {
    throw SqlFailure(SQLITE_ERROR, "more than " + std::to_string(MAX_COLUMNS) + " columns");
  }
  for (const char* szName : {"oid", "_rowid_", "rowid"}) {
    if (FindName(All, szName) == -1) {
      pTable->strRowid = szName;
    }
  }
}

bool HasNull(const Database& Db, const ChangedTable& Table, const std::string& strSide) {
  std::string strSql = "SELECT 1 FROM " + strSide + "." + Quoted(Table.strName) + " WHERE 0";
  for (const std::string& strKey : Table.Keys) {
    strSql += " OR " + Quoted(strKey) + " IS NULL";
  }
  return Statement(Db, strSql).Step();
}

// Returns the name of the index of the primary key, or "". The key of a table with a rowid may hold
// NULL, even twice; then only the rowid identifies a row.
std::string ReadKeys(const Database& Db, const Object& Object, ChangedTable* pTable) {
  const std::vector<std::string> Index = Strings(
      {Db, "SELECT name FROM pragma_index_list(?, 'before') WHERE origin = 'pk'"}, pTable->strName);
  if (Index.empty()) {
    pTable->Keys =
        Strings({Db, "SELECT name FROM pragma_table_info(?, 'before') WHERE pk"}, pTable->strName);
    pTable->Collations = {"BINARY"};
    if (!pTable->Keys.empty()) {
      pTable->strRowid = pTable->Keys[0];
      return "";
    }
  } else {
    const std::string strInfo = " FROM pragma_index_xinfo(?, 'before') WHERE key";
    pTable->Keys = Strings({Db, "SELECT name" + strInfo}, Index[0]);
    pTable->Collations = Strings({Db, "SELECT coll" + strInfo}, Index[0]);
    if (Object.blWithoutRowid) {
      pTable->strRowid.clear();
      return "";
    }
    if (!HasNull(Db, *pTable, "before") && !HasNull(Db, *pTable, "after")) {
      return Index[0];
    }
  }
  if (pTable->strRowid.empty()) {
    throw SqlFailure(SQLITE_ERROR, "columns hide every name of its rowid");
  }
  pTable->blRowidOnly = true;
  pTable->Keys = {pTable->strRowid};
  pTable->Collations = {"BINARY"};
  return "";
}

// --- Rows that differ ---

// Fills before_N and after_N. A single number is stored as the rowid, not twice. Indexes other than
// the primary key's are not used: they may need what only the recorder has.
void StoreRows(const Database& Db, const ChangedTable& Table, const std::string& strIndex) {
  const bool blNumber = Table.Keys.size() == 1 && Table.Keys[0] == Table.strRowid;
  const std::string strKeys = Numbered("k", Table.Keys);
  const bool blRowid = !blNumber && !Table.strRowid.empty();
  const WordMap Words = {
      {"n", std::to_string(Table.Number)},
      {"table", Quoted(Table.strName)},
      {"stored", (blNumber ? "k0 INTEGER PRIMARY KEY, " : strKeys + ", ") +
                     Numbered("c", Table.Columns) +
                     (blNumber ? ", r)" : ", r, PRIMARY KEY (" + strKeys + ")) WITHOUT ROWID")},
      {"keys", ForEach(Table.Keys, "t.{name}", ", ")},
      {"row", ForEach(Table.Columns, "t.{name}, ", "") +
                  (blRowid ? "t." + Quoted(Table.strRowid) : "NULL")},
      {"by_key", strIndex.empty() ? "NOT INDEXED" : "INDEXED BY " + Quoted(strIndex)},
      {"same_keys", SameKeys(Table, "u", "t.{name}")},
      {"same_row", ForEach(Table.Columns, "(" + SameValue("u.{name}", "t.{name}") + ")", " AND ")},
      {"keys_before", Numbered("b.k", Table.Keys)},
      {"same_keys_before", SameKeys(Table, "t", "b.k{i}")},
  };
  for (const char* szSql : {
           "CREATE TABLE before_{n} ({stored}",
           "CREATE TABLE after_{n} ({stored}",
           R"(INSERT INTO before_{n} SELECT {keys}, {row} FROM before.{table} AS t NOT INDEXED
                WHERE NOT EXISTS (SELECT 1 FROM after.{table} AS u {by_key}
                                  WHERE {same_keys} AND {same_row}))",
           R"(INSERT INTO after_{n} SELECT {keys_before}, {row}
                FROM before_{n} AS b CROSS JOIN after.{table} AS t {by_key}
                WHERE {same_keys_before})",
           R"(INSERT INTO after_{n} SELECT {keys}, {row} FROM after.{table} AS t NOT INDEXED
                WHERE NOT EXISTS (SELECT 1 FROM before.{table} AS u {by_key} WHERE {same_keys}))",
       }) {
    Db.Execute(Fill(szSql, Words));
  }
}

bool HasChanges(const Database& Db, const ChangedTable& Table) {
  const std::string strNumber = std::to_string(Table.Number);
  return Statement(Db, "SELECT 1 FROM before_" + strNumber + " UNION ALL SELECT 1 FROM after_" +
                           strNumber)
      .Step();
}

void DropRows(const Database& Db, const ChangedTable& Table) {
  for (const char* szTable : {"before_", "after_"}) {
    Db.Execute("DROP TABLE IF EXISTS " + (szTable + std::to_string(Table.Number)));
  }
}

void Compare(const Database& Db, const Object& Object, ChangedTable* pTable) {
  try {
    ReadColumns(Db, pTable);
    const std::string strIndex = ReadKeys(Db, Object, pTable);
    // A collation that only the recorder has gets a clear message here.
    const Statement Ordered(Db, "SELECT 1 FROM before." + Quoted(pTable->strName) + " ORDER BY " +
                                    ForEach(pTable->Keys, "{name}", ", "));
    StoreRows(Db, *pTable, strIndex);
    if (Object.blShadow) {
      pTable->blDoubt = HasChanges(Db, *pTable);
      pTable->strReason = "holds the content of a virtual table";
    }
  } catch (const SqlFailure& Reason) {
    // Such as a collation that only the recorder has.
    if (Reason.Code() != SQLITE_ERROR) {
      throw;
    }
    pTable->strReason = Reason.what();
    pTable->blDoubt = true;
  }
  if (!pTable->strReason.empty()) {
    DropRows(Db, *pTable);
  }
}

// --- The other tables ---

std::vector<Object> ListObjects(const Database& Db) {
  Statement List(Db, OBJECTS);
  std::vector<Object> Objects;
  while (List.Step()) {
    Object Next = {{}, List.Int(1) != 0, List.Int(5) != 0};
    Next.Table.Number = static_cast<int>(Objects.size());
    Next.Table.strName = List.Text(0);
    Next.Table.strDefinition = List.Text(2);
    Next.Table.blDoubt = !List.Text(3).empty();
    Next.Table.strReason = Next.Table.blDoubt ? List.Text(3) : List.Text(4);
    Objects.push_back(Next);
  }
  return Objects;
}

std::string JsonArray(const Database& Db, const std::vector<std::string>& Strings) {
  std::string strArray = "[]";
  Statement Append(Db, "SELECT json_insert(?, '$[#]', ?)");
  for (const std::string& strString : Strings) {
    Append.Bind(1, strArray);
    Append.Bind(2, strString);
    Append.Step();
    strArray = Append.Text(0);
  }
  return strArray;
}

}  // namespace

void MakeChangeFile(const std::string& strFile, const std::string& strBefore,
                    const std::string& strAfter, const Upgrade& Info) {
  // SQLite would create it with a mode that others can read.
  if (fileops::Descriptor(open(strFile.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600))
          .Get() == -1) {
    throw SystemFailure("cannot create " + strFile);
  }
  const std::string strEncoding =
      Database(strBefore, SQLITE_OPEN_READWRITE).Text("PRAGMA encoding");
  Database Db(strFile, SQLITE_OPEN_READWRITE);
  Db.Execute(SETTINGS + Quoted(strEncoding));
  Db.Attach(strBefore, "before");
  Db.Attach(strAfter, "after");
  Db.Execute(std::string("BEGIN;") + TABLES + APPLICATION_ID + "; PRAGMA user_version = " + FORMAT);
  Db.Run("INSERT INTO upgrade VALUES (?, ?, ?, ?, ?, ?, ?)", Info.strVersion, Info.strTool,
         Info.strToolVersion, Info.strTime, Info.strDatabase, Info.Inode, Info.SchemaVersion);
  for (Object& Object : ListObjects(Db)) {
    ChangedTable& Table = Object.Table;
    if (Table.strReason.empty()) {
      Compare(Db, Object, &Table);
    }
    Db.Run("INSERT INTO covered VALUES (?, ?, ?, ?, ?, ?, ?, ?, ?, ?)", int64_t{Table.Number},
           Table.strName, JsonArray(Db, Table.Keys), JsonArray(Db, Table.Collations),
           JsonArray(Db, Table.Columns), Table.strRowid, int64_t{Table.blRowidOnly},
           Table.strDefinition, Table.strReason, int64_t{Table.blDoubt});
  }
  ListDangling(Db, "before", "main.dangling");
  Db.Execute("COMMIT");
}

void AddFile(const Database& Changes, const std::string& strName, std::string_view Before,
             std::string_view After) {
  Changes.Run("INSERT INTO file VALUES (?, ?, ?)", strName, Before, After);
}

Upgrade ReadUpgrade(const Database& Changes) {
  const char* szFile = sqlite3_db_filename(Changes.Get(), "main");
  if (Changes.Text("PRAGMA application_id") != APPLICATION_ID) {
    throw Failure(szFile + std::string(" is not a change file"));
  }
  if (Changes.Text("PRAGMA user_version") != FORMAT) {
    throw Failure(szFile + std::string(" has the format of another version"));
  }
  Statement Read(Changes, "SELECT * FROM upgrade");
  if (!Read.Step()) {
    throw Failure(szFile + std::string(" is not complete"));
  }
  return {Read.Text(0), Read.Text(1), Read.Text(2), Read.Text(3),
          Read.Text(4), Read.Int(5),  Read.Int(6)};
}

std::vector<ChangedTable> ReadTables(const Database& Changes) {
  ReadUpgrade(Changes);
  const auto List = [&](const std::string& strArray) {
    return Strings({Changes, "SELECT value FROM json_each(?)"}, strArray);
  };
  Statement Read(Changes, "SELECT * FROM covered ORDER BY number");
  std::vector<ChangedTable> Tables;
  while (Read.Step()) {
    ChangedTable Table;
    Table.Number = static_cast<int>(Read.Int(0));
    Table.strName = Read.Text(1);
    Table.Keys = List(Read.Text(2));
    Table.Collations = List(Read.Text(3));
    Table.Columns = List(Read.Text(4));
    Table.strRowid = Read.Text(5);
    Table.blRowidOnly = Read.Int(6) != 0;
    Table.strDefinition = Read.Text(7);
    Table.strReason = Read.Text(8);
    Table.blDoubt = Read.Int(9) != 0;
    if (FindName({"camera"}, Table.strName) == 0) {
      Table.Vendor = FindName(Table.Columns, "vendor");
      Table.Model = FindName(Table.Columns, "model");
    }
    Tables.push_back(Table);
  }
  return Tables;
}

int FindName(const std::vector<std::string>& Names, const std::string& strName) {
  const auto IsIt = [&](const std::string& strIt) {
    return sqlite3_stricmp(strIt.c_str(), strName.c_str()) == 0;
  };
  const auto Found = std::find_if(Names.begin(), Names.end(), IsIt);
  return Found == Names.end() ? -1 : static_cast<int>(Found - Names.begin());
}

std::string RowName(const ChangedTable& Table, const Statement& Row, int FirstKey,
                    int FirstColumn) {
  std::string strName = Name(Table.strName);
  for (size_t Key = 0; Key < Table.Keys.size(); ++Key) {
    strName += (Key == 0 ? " " : ", ") + Shown(Row.Value(FirstKey + static_cast<int>(Key)));
  }
  if (FirstColumn == -1 || !Table.IsCamera()) {
    return strName;
  }
  return strName + " (" + Plain(Row.Value(FirstColumn + Table.Vendor)) + " " +
         Plain(Row.Value(FirstColumn + Table.Model)) + ")";
}

// --- SQL ---

std::string Numbered(const std::string& strPrefix, const std::vector<std::string>& Names) {
  return ForEach(Names, strPrefix + "{i}", ", ");
}

std::string SameKeys(const ChangedTable& Table, const std::string& strRow,
                     const std::string& strKey) {
  const std::string strSame = " AND " + strRow + ".{name} = " + strKey + " COLLATE ";
  std::string strSql = "1";
  for (size_t Key = 0; Key < Table.Keys.size(); ++Key) {
    const std::string strName = Quoted(Table.Keys[Key]);
    strSql += Fill(strSame, {{"name", strName}, {"i", std::to_string(Key)}});
    strSql += Quoted(Table.Collations[Key]);
  }
  return strSql;
}

void ListDangling(const Database& Db, const std::string& strSchema, const std::string& strList) {
  const WordMap Words = {{"schema", strSchema}, {"list", strList}};
  Statement Tables(Db, Fill("SELECT name FROM {schema}.sqlite_schema WHERE type = 'table'", Words));
  while (Tables.Step()) {
    try {
      Db.Run(Fill(DANGLING, Words), Tables.Text(0));
    } catch (const SqlFailure& Reason) {
      // The columns that it refers to are not unique: SQLite cannot check this table.
      if (Reason.Code() != SQLITE_ERROR) {
        throw;
      }
    }
  }
}

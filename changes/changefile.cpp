#include "changefile.h"

#include <fcntl.h>

#include <algorithm>

#include "fileops.h"

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
    "CREATE TABLE covered (number INTEGER PRIMARY KEY, name, definition, without_rowid, keys,"
    "  collations, columns, rowid_name, rowid_only, key_index, reason, doubt);"
    "CREATE TABLE dangling (child, row, parent, id, count);"
    "CREATE TABLE file (name PRIMARY KEY, before, after);"
    "PRAGMA application_id = ";

// Lists all tables and views. Those that can be compared have no reason yet. If only the recorder
// has the module of a virtual table (ncol is 0), the tables that hold its content are known by
// their names alone.
constexpr const char* LIST_TABLES = R"(
  WITH definition AS (
    SELECT 'before' AS side, name, sql FROM before.sqlite_schema WHERE type IN ('table', 'view')
    UNION ALL
    SELECT 'after', name, sql FROM after.sqlite_schema WHERE type IN ('table', 'view')),
  listed AS (
    SELECT name, max(wr) AS wr, max(sql) AS sql, CASE
        WHEN count(*) = 1 THEN 'exists only ' || side || ' the upgrade'
        WHEN min(sql) IS NOT max(sql) THEN 'the upgrade changes its definition'
      END AS change, CASE
        WHEN type = 'view' THEN type
        WHEN type = 'virtual' THEN 'virtual table'
        WHEN name = 'sqlite_sequence' THEN 'an id is never given out twice'
        WHEN name LIKE 'sqlite\_%' ESCAPE '\' THEN 'belongs to SQLite'
      END AS kind, type = 'shadow' OR EXISTS (
        SELECT 1 FROM pragma_table_list AS v WHERE v.type = 'virtual' AND v.ncol = 0
        AND substr(l.name, 1, length(v.name) + 1) = v.name || '_' COLLATE NOCASE) AS shadow
    FROM definition JOIN pragma_table_list AS l USING (name) WHERE l.schema = side
    GROUP BY name)
  INSERT INTO covered (name, definition, reason, doubt, without_rowid)
  SELECT name, sql,
    coalesce(change, kind, iif(shadow, 'holds the content of a virtual table', '')),
    iif(coalesce(change, kind) IS NULL, NULL, change IS NOT NULL), wr
  FROM listed ORDER BY name)";

// Finds what identifies a row: the primary key, by its index if there is one, or the rowid.
constexpr const char* LIST_COLUMNS = R"(
  UPDATE covered AS t SET
    columns = (SELECT json_group_array(name) FROM pragma_table_xinfo(t.name, 'before')
               WHERE NOT hidden),
    key_index = (SELECT name FROM pragma_index_list(t.name, 'before') WHERE origin = 'pk'),
    rowid_name = (SELECT column1 FROM (VALUES ('rowid'), ('_rowid_'), ('oid'))
                  WHERE NOT without_rowid AND column1 NOT IN (
                    SELECT lower(name) FROM pragma_table_xinfo(t.name, 'before')) LIMIT 1)
  WHERE doubt IS NULL;
  UPDATE covered AS t SET (keys, collations, key_index) = (
    SELECT json_group_array(name), json_group_array(coll), iif(t.without_rowid, NULL, t.key_index)
    FROM pragma_index_xinfo(t.key_index, 'before') WHERE key)
  WHERE key_index IS NOT NULL;
  UPDATE covered AS t SET keys = json_array(c.name), collations = '["BINARY"]', rowid_name = c.name
  FROM (SELECT t.name AS of, c.name FROM covered AS t JOIN pragma_table_info(t.name, 'before') AS c
        WHERE t.doubt IS NULL AND t.keys IS NULL AND c.pk) AS c
  WHERE t.name = c.of)";

constexpr const char* USE_ROWID = R"(
  UPDATE covered SET keys = json_array(rowid_name), collations = '["BINARY"]', rowid_only = 1,
    key_index = NULL
  WHERE keys IS NULL AND doubt IS NULL OR number = )";

constexpr const char* DANGLING = R"(
  INSERT INTO {list} SELECT "table", rowid, parent, fkid, count(*)
  FROM pragma_foreign_key_check(?, '{schema}') GROUP BY 1, 2, 3, 4)";

// Returns the tables that the condition selects.
std::vector<ChangedTable> ReadCovered(const Database& Changes, const std::string& strWhere) {
  const auto List = [&](const char* szArray, int64_t Number) {
    Statement Elements(Changes, "SELECT e.value FROM covered, json_each(" + std::string(szArray) +
                                    ") AS e WHERE number = ?");
    Elements.Bind(1, Number);
    std::vector<std::string> Result;
    while (Elements.Step()) {
      Result.push_back(Elements.Text(0));
    }
    return Result;
  };
  Statement Read(Changes,
                 "SELECT number, name, rowid_name, rowid_only, key_index, definition, reason, doubt"
                 " FROM covered WHERE " +
                     strWhere + " ORDER BY number");
  std::vector<ChangedTable> Tables;
  while (Read.Step()) {
    ChangedTable Table;
    Table.Number = Read.Int(0);
    Table.strName = Read.Text(1);
    Table.Keys = List("keys", Table.Number);
    Table.Collations = List("collations", Table.Number);
    Table.Columns = List("columns", Table.Number);
    Table.strRowid = Read.Text(2);
    Table.blRowidOnly = Read.Int(3) != 0;
    Table.strKeyIndex = Read.Text(4);
    Table.strDefinition = Read.Text(5);
    Table.strReason = Read.Text(6);
    Table.blDoubt = Read.Int(7) != 0;
    if (FindName({"camera"}, Table.strName) == 0) {
      Table.Vendor = FindName(Table.Columns, "vendor");
      Table.Model = FindName(Table.Columns, "model");
    }
    Tables.push_back(Table);
  }
  return Tables;
}

// --- Rows that differ ---

// Fills before_N and after_N. A single number is stored as the rowid, not twice. Indexes other than
// the primary key's are not used: they may need what only the recorder has.
void StoreRows(const Database& Db, const ChangedTable& Table) {
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
      {"by_key",
       Table.strKeyIndex.empty() ? "NOT INDEXED" : "INDEXED BY " + Quoted(Table.strKeyIndex)},
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

bool HasNull(const Database& Db, const ChangedTable& Table, const std::string& strSide) {
  return Statement(Db, "SELECT 1 FROM " + strSide + "." + Quoted(Table.strName) + " WHERE " +
                           ForEach(Table.Keys, "{name} IS NULL", " OR "))
      .Step();
}

// Creates before_N and after_N unless the table turns out not to be comparable. Then says why.
void Compare(const Database& Db, ChangedTable Table) {
  const std::string strNumber = std::to_string(Table.Number);
  const std::string strThis = "number = " + strNumber;
  std::string strReason = Table.strReason;
  bool blDoubt = false;
  try {
    if (Table.Columns.size() > MAX_COLUMNS) {
      throw SqlFailure(SQLITE_ERROR, "more than " + std::to_string(MAX_COLUMNS) + " columns");
    }
    // The key of a table with a rowid may hold NULL, even twice.
    if (!Table.strKeyIndex.empty() &&
        (HasNull(Db, Table, "before") || HasNull(Db, Table, "after"))) {
      Db.Execute(USE_ROWID + strNumber);
      Table = ReadCovered(Db, strThis)[0];
    }
    if (Table.blRowidOnly && Table.strRowid.empty()) {
      throw SqlFailure(SQLITE_ERROR, "columns hide every name of its rowid");
    }
    // A collation that only the recorder has gets a clear message here.
    const Statement Ordered(Db, "SELECT 1 FROM before." + Quoted(Table.strName) + " ORDER BY " +
                                    ForEach(Table.Keys, "{name}", ", "));
    StoreRows(Db, Table);
    blDoubt = !strReason.empty() && !Db.Run("SELECT 1 FROM before_" + strNumber +
                                            " UNION ALL SELECT 1 FROM after_" + strNumber)
                                         .empty();
  } catch (const SqlFailure& Reason) {
    if (Reason.Code() != SQLITE_ERROR) {
      throw;
    }
    strReason = Reason.what();
    blDoubt = true;
  }
  if (!strReason.empty()) {
    Db.Execute("DROP TABLE IF EXISTS before_" + strNumber);
    Db.Execute("DROP TABLE IF EXISTS after_" + strNumber);
  }
  Db.Run("UPDATE covered SET reason = ?, doubt = ? WHERE " + strThis, strReason, int64_t{blDoubt});
}

}  // namespace

void MakeChangeFile(const std::string& strFile, const std::string& strBefore,
                    const std::string& strAfter, const Upgrade& Info) {
  // SQLite would create it with a mode that others can read.
  if (fileops::Descriptor(open(strFile.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600))
          .Get() == -1) {
    throw SystemFailure("cannot create " + strFile);
  }
  const std::string strEncoding = Database(strBefore, SQLITE_OPEN_READWRITE).Run("PRAGMA encoding");
  Database Db(strFile, SQLITE_OPEN_READWRITE);
  Db.Execute(SETTINGS + Quoted(strEncoding));
  Db.Attach(strBefore, "before");
  Db.Attach(strAfter, "after");
  Db.Execute(std::string("BEGIN;") + TABLES + APPLICATION_ID + "; PRAGMA user_version = " + FORMAT);
  Db.Run("INSERT INTO upgrade VALUES (?, ?, ?, datetime() || ' UTC', ?, ?, ?)", Info.strVersion,
         Info.strTool, Info.strToolVersion, Info.strDatabase, Info.Inode, Info.SchemaVersion);
  Db.Execute(LIST_TABLES);
  Db.Execute(LIST_COLUMNS);
  Db.Execute(USE_ROWID + std::string("NULL"));
  for (const ChangedTable& Table : ReadCovered(Db, "doubt IS NULL")) {
    Compare(Db, Table);
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
  if (Changes.Run("PRAGMA application_id") != APPLICATION_ID) {
    throw Failure(szFile + std::string(" is not a change file"));
  }
  if (Changes.Run("PRAGMA user_version") != FORMAT) {
    throw Failure(szFile + std::string(" has the format of another version"));
  }
  Statement Read(
      Changes, "SELECT version, tool, tool_version, database, inode, schema_version FROM upgrade");
  if (!Read.Step()) {
    throw Failure(szFile + std::string(" is not complete"));
  }
  return {Read.Text(0), Read.Text(1), Read.Text(2), Read.Text(3), Read.Int(4), Read.Int(5)};
}

std::vector<ChangedTable> ReadTables(const Database& Changes) {
  ReadUpgrade(Changes);
  return ReadCovered(Changes, "1");
}

int FindName(const std::vector<std::string>& Names, const std::string& strName) {
  const auto IsIt = [&](const std::string& strIt) {
    return sqlite3_stricmp(strIt.c_str(), strName.c_str()) == 0;
  };
  const auto Found = std::find_if(Names.begin(), Names.end(), IsIt);
  return Found == Names.end() ? -1 : static_cast<int>(Found - Names.begin());
}

// --- SQL ---

std::string Numbered(const std::string& strPrefix, const std::vector<std::string>& Names) {
  return ForEach(Names, strPrefix + "{i}", ", ");
}

std::string ForEachKey(const ChangedTable& Table, const std::string& strPattern,
                       const std::string& strBetween) {
  std::string strSql;
  for (size_t Key = 0; Key < Table.Keys.size(); ++Key) {
    strSql += (Key == 0 ? "" : strBetween) +
              Fill(strPattern, {{"name", Quoted(Table.Keys[Key])},
                                {"i", std::to_string(Key)},
                                {"collation", Quoted(Table.Collations[Key])}});
  }
  return strSql;
}

std::string SameKeys(const ChangedTable& Table, const std::string& strRow,
                     const std::string& strKey) {
  return ForEachKey(Table, strRow + ".{name} = " + strKey + " COLLATE {collation}", " AND ");
}

std::string RowName(const ChangedTable& Table, const std::string& strKey) {
  return "shown_name(" + Literal(Table.strName) + ") || ' ' || " +
         ForEach(Table.Keys, "shown(" + strKey + ")", " || ', ' || ");
}

std::string CameraName(const ChangedTable& Table, const std::string& strCell) {
  const auto Cell = [&](int Column) {
    return "plain(" + Fill(strCell, {{"i", std::to_string(Column)}}) + ")";
  };
  return Table.IsCamera()
             ? "' (' || " + Cell(Table.Vendor) + " || ' ' || " + Cell(Table.Model) + " || ')'"
             : "''";
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

// Connections, statements and result sets of the package's SQLite databases.
//
// Only one thread at a time may use a connection or a result set.
#pragma once

struct DBConnect_tag;
struct DBResult_tag;
typedef struct DBConnect_tag DBConnect;
typedef struct DBResult_tag DBResult;

// Identifies one row of a result set.
typedef unsigned long DBRow;

// Opens the existing database file szDBName for reading and writing. Ignores host, user and
// password. Returns a connection that the caller releases with ZAMODBClose, or null if the name
// does not lead to a regular file that can be read and written. Never creates a file.
DBConnect* ZAMODBConnect(const char* szHost, const char* szUser, const char* szPassword,
                         const char* szDBName);

// Runs the statements of szSqlCmd in order and stops at the first failure. Waits up to five seconds
// for each lock that another process holds. Returns 0, or -1 on failure. A text that leaves a
// transaction open is a failure too. So is one that uses another database (ATTACH, VACUUM INTO).
// Every failure rolls back an open transaction. After success, what the text has committed is on
// stable storage.
//
// On success, if ppResult is not null, *ppResult receives the result set of the last statement that
// returns columns, even if it has no rows. The caller releases it with ZAMODBFreeResult. It holds
// copies and outlives the connection. On failure, or if no statement returns columns, *ppResult is
// unchanged.
int ZAMODBExecute(DBConnect* pConn, const char* szSqlCmd, DBResult** ppResult);

// Why the calling thread's last ZAMODBConnect or ZAMODBExecute failed: SQLite's reason with its
// extended code, or the name of the database with the system's reason. It may contain any bytes of
// the text. Valid until the thread's next failure.
const char* ZAMODBError();

// Number of rows; 0 for null.
unsigned int ZAMODBNumRows(const DBResult* pResult);

// Sets *pRow to the next row; the first call gives the first row. Returns 0, or -1 if there is no
// further row.
int ZAMODBFetchRow(DBResult* pResult, DBRow* pRow);

// The value of column szColumn in that row, as text that the result set owns. Upper and lower case
// in the column's name are the same. Null for an SQL NULL, an unknown column or an unknown row.
const char* ZAMODBFetchField(const DBResult* pResult, DBRow Row, const char* szColumn);

// Releases a result set. Null is allowed.
void ZAMODBFreeResult(DBResult* pResult);

// Closes a connection. Null is allowed.
void ZAMODBClose(DBConnect* pConn);

// Connections, statements and result sets over the package's SQLite databases.
//
// A connection and a result set may be used by one thread at a time. Every failure that SQLite
// gives a reason for is reported to syslog at LOG_ERR with that reason and the database's name.
#pragma once

struct DBConnect_tag;
struct DBResult_tag;
typedef struct DBConnect_tag DBConnect;
typedef struct DBResult_tag DBResult;

// Addresses one row of a result set.
typedef unsigned long DBRow;

// Opens the existing database file szDBName for reading and writing; host, user and password are
// ignored. Returns a connection that the caller releases with ZAMODBClose, or null when the name
// does not lead to a regular file that can be opened so. Never creates a file.
DBConnect* ZAMODBConnect(const char* szHost, const char* szUser, const char* szPassword,
                         const char* szDBName);

// Runs every statement of szSqlCmd, in order, up to the first that fails; waits up to five seconds
// for a lock that another process holds. Returns 0, or -1 on failure. A text must leave no
// transaction open behind it: that is a failure too, and on every failure an open transaction is
// rolled back.
// With success and a non-null ppResult, the result set of the last statement that yields columns,
// which may be one of no rows, is stored there, or null when no statement does; the caller releases
// it with ZAMODBFreeResult. It holds copies and outlives the connection. On failure *ppResult is
// left as it was.
int ZAMODBExecute(DBConnect* pConn, const char* szSqlCmd, DBResult** ppResult);

// Number of rows; 0 for null.
unsigned int ZAMODBNumRows(const DBResult* pResult);

// Lets *pRow address the next row, the first one on the first call. Returns 0, or -1 when there is
// no further row.
int ZAMODBFetchRow(DBResult* pResult, DBRow* pRow);

// The value of column szColumn (matched like SQL names, whatever the letter case) in that row, as
// text that the result set keeps owning; null for an SQL NULL, an unknown column or row.
const char* ZAMODBFetchField(const DBResult* pResult, DBRow Row, const char* szColumn);

// Null is allowed.
void ZAMODBFreeResult(DBResult* pResult);

// Null is allowed.
void ZAMODBClose(DBConnect* pConn);

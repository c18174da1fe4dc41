// Runs SQL commands on the package's databases.
#pragma once

#include <string>

#include "zamodb.h"

namespace KiDB {

typedef enum __DB_INSTANCE : int {
  DBI_SYSTEM = 0,     // /var/packages/Camveld/target/system.db
  DBI_RECORDING = 1,  // /var/services/camveld/recording.db
  DBI_CNT = 2,        // number of databases
} DB_INSTANCE;

// Opens the database, runs strCommand between "BEGIN;" and ";COMMIT;", and closes the database.
// Returns 0. If the database cannot be opened or a statement fails, logs the failure, commits
// nothing and returns -1. ZAMODBError then gives the reason.
//
// If a query succeeds and ppResult is not null, *ppResult receives the result set, which the caller
// releases with KiDBFreeResult. If there is no result set, *ppResult is unchanged: set it to null
// before the call. If blReplaceBoolForSqlite is true, every "true", "TRUE", "false" and "FALSE" in
// strCommand, even inside names and quotes, is replaced by 1 or 0.
//
// Any thread may call it. Calls for the same database run one after another. A request to cancel
// the thread waits until the call ends. If memory runs out, std::bad_alloc may leave the call;
// nothing is then committed that is not whole, and nothing stays open.
int Execute(DB_INSTANCE DBInstance, std::string strCommand, DBResult_tag** ppResult,
            bool blReplaceBoolForSqlite);

// Releases a result set that Execute returned. Null is allowed.
void KiDBFreeResult(DBResult_tag* pResult);

}  // namespace KiDB

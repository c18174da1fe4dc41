// Runs SQL texts against the package's databases.
#pragma once

#include <string>

#include "zamodb.h"

namespace KiDB {

typedef enum __DB_INSTANCE : int {
  DBI_SYSTEM = 0,     // /var/packages/Camveld/target/system.db
  DBI_RECORDING = 1,  // /var/services/camveld/recording.db
  DBI_CNT = 2,        // how many there are, not a database
} DB_INSTANCE;

// Connects to a database, runs strCommand between "BEGIN;" and ";COMMIT;", and closes. Returns 0,
// or -1 after logging why: no connection, or a statement failed, and then nothing of the text is
// committed.
//
// With a non-null ppResult the result set of a successful query is stored in *ppResult; the caller
// releases it with KiDBFreeResult. *ppResult is left as it was when there is none: set it to null
// first. With blReplaceBoolForSqlite every "true", "TRUE", "false" and "FALSE" of the text, inside
// names and quotes too, is run as 1 or 0.
//
// Any thread may call it; calls for one database take turns.
int Execute(DB_INSTANCE DBInstance, std::string strCommand, DBResult_tag** ppResult,
            bool blReplaceBoolForSqlite);

// Releases a result set that Execute handed back; null is allowed.
void KiDBFreeResult(DBResult_tag* pResult);

}  // namespace KiDB

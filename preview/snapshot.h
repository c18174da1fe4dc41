// Copies a database that may be in use.
#pragma once

#include <string>

// Copies the database in the state of its last committed transaction. Never creates, changes or
// removes the database, its journal, write-ahead log or shared memory, not even after a crash of
// its user. Waits up to five seconds for a lock. Throws Failure.
void CopyDatabase(const std::string& strDatabase, const std::string& strCopy);

// A consistent copy of a database that may be in use.
#pragma once

#include <string>

// Copies the database as its last committed transaction left it. Neither the database nor its
// journal, write-ahead log or shared memory is created, changed or removed, whatever state its
// users have left it in. Waits up to five seconds for one that locks it. Throws Failure.
void CopyDatabase(const std::string& strDatabase, const std::string& strCopy);

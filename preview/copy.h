// Reads what an upgrade would change, and copies it into the work directory. All functions throw
// Failure.
#pragma once

#include <cstdint>
#include <string>

// Throws unless the file system of the current directory has room for the preview of a database and
// of a directory of capability files, which may be "".
void CheckRoom(const std::string& strDatabase, const std::string& strCaps);

// Copies a database, which may be in use, in the state of its last committed transaction. Waits up
// to five seconds for its users. As whoever opens the database, completes the rollback that a crash
// has left. Returns the database's schema version, which the copy does not have.
int64_t CopyDatabase(const std::string& strFrom, const std::string& strTo);

// Copies the files that can be capability files from one directory to another: regular files that
// are not too large for the tool, and those that links lead to.
void CopyCapFiles(const std::string& strFrom, const std::string& strTo);

// Returns the content of a file.
std::string ReadFile(const std::string& strFile);

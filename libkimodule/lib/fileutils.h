// Key-value files: the package's small settings, kept as lines of "key=value".
//
// The key is everything before the first '=' of a line, and may be empty. The value is what stands
// between the first double quote after that '=' and the last one of the line; with fewer than two
// it is everything after the '=', blanks and a carriage return included. There are no escapes and
// no comments: a line without '=' carries nothing. Of several lines with one key the first counts.
// Keys and values are bytes of any kind but line feeds, which end a line.
//
// A call locks the file (see kiflock.h) and waits for others that do, however long: it can be made
// from any thread of any process. Why it failed is logged under LOG_CATEG_UTILS, LOG_LEVEL_ERROR.
#pragma once

#include <map>
#include <set>
#include <string>

// Read szFile, or the pairs of it whose keys are in Keys, into KeyVals, which is emptied first. A
// missing file is created empty (mode 0644 less the umask) and has no pairs. Return the number of
// lines that carry such a pair, repeated keys included, or -1 when the file cannot be created,
// locked or opened; KeyVals is then empty. A read error ends the reading as the end of the file
// does.
int KiFileGetAllKeyVals(const char* szFile, std::map<std::string, std::string>& KeyVals);
int KiFileGetKeyVals(const char* szFile, const std::set<std::string>& Keys,
                     std::map<std::string, std::string>& KeyVals);

// Reads the value of szKey into strVal, which is empty when there is none. Returns the number of
// lines with that key, so 0 when it is absent, or -1 as above.
int KiFileGetVal(const char* szFile, const char* szKey, std::string& strVal);

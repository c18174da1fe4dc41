// Key-value files: the package's small settings, kept as lines of "key=value".
//
// The key is everything before the first '=' of a line, and may be empty. The value is what stands
// between the first double quote after that '=' and the last one of the line; with fewer than two
// it is everything after the '=', blanks and a carriage return included. There are no escapes and
// no comments: a line without '=' carries nothing. Of several lines with one key the first counts.
// Keys and values are bytes of any kind but line feeds, which end a line.
//
// A call locks the file (see kiflock.h) and waits for others that do, however long: it can be made
// from any thread of any process. Why one failed is logged under LOG_CATEG_UTILS, LOG_LEVEL_ERROR.
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

// Set the pairs in szFile, or remove the keys from it; a missing file is created as by reading. The
// others keep their values, but the whole file is written anew: one line a pair, by ascending key
// bytes, every value in double quotes if blQuoteVal (never after a removal), without the lines that
// carried nothing. Keys must be free of '=' and of line feeds, values of line feeds; a value with
// two double quotes in it is read back whole only if it was written in quotes.
//
// The file is replaced by one with its owner, group and mode, made beside it as
// "szFile.tmp.XXXXXX": whoever opens it sees all of a change or nothing, and no change of another
// caller is lost. A symbolic link is itself replaced. The new content is not forced to stable
// storage. Thread cancellation is disabled meanwhile and always enabled on return.
//
// Return 0, at once when there is nothing to set or remove, or -1 with the file as it was: it
// cannot be read, or not be replaced by one of the same owner (a process without privilege can only
// give files to itself).
int KiFileSetVal(const char* szFile, const char* szKey, const char* szVal, bool blQuoteVal);
int KiFileSetVals(const char* szFile, const std::map<std::string, std::string>& NewKeyVals,
                  bool blQuoteVal);
int KiFileRemoveKey(const char* szFile, const char* szKey);
int KiFileRemoveKeys(const char* szFile, const std::set<std::string>& Keys);

// Creates an empty file of mode 0600 with a name of its own, szTemplate followed by ".tmp." and six
// characters. Returns the name, or the empty string after logging why. The caller removes the file.
std::string CreateTmpFile(const char* szTemplate);

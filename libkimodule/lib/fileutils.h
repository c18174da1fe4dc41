// Key-value files: small settings of the package, in lines "key=value".
//
// The key is everything before the first '=' of a line and may be empty. The value is the text
// between the first and the last double quote after that '='. With fewer than two double quotes, it
// is everything after the '=', including blanks and a carriage return. There are no escapes and no
// comments. A line without '=' has no meaning. If several lines have the same key, the first line
// counts. Keys and values may contain any bytes except line feeds, which end a line.
//
// A call locks the file (see kiflock.h) and waits for the lock without a time limit, whatever
// signals arrive. Any thread of any process may call. The reason for a failure is logged under
// LOG_CATEG_UTILS, LOG_LEVEL_ERROR.
#pragma once

#include <map>
#include <set>
#include <string>

// Empty KeyVals, then read into it all pairs of szFile or those whose keys are in Keys. Create an
// empty file (mode 0644 less the umask) if it is missing. Return the number of lines with such a
// pair, including repeated keys, or -1 if the file cannot be created, locked or opened; KeyVals is
// then empty. A read error counts as the end of the file.
int KiFileGetAllKeyVals(const char* szFile, std::map<std::string, std::string>& KeyVals);
int KiFileGetKeyVals(const char* szFile, const std::set<std::string>& Keys,
                     std::map<std::string, std::string>& KeyVals);

// Reads the value of szKey into strVal, which is empty if there is none. Returns the number of
// lines with that key (0 if it is absent), or -1 as above.
int KiFileGetVal(const char* szFile, const char* szKey, std::string& strVal);

// Set the pairs in szFile, or remove the keys from it. Create a missing file as reading does. Other
// keys keep their values, but the whole file is written anew: one line per key, sorted by the bytes
// of the keys, without the lines that had no '='. If blQuoteVal is true, every value is written in
// double quotes; a removal writes no quotes. Keys must not contain '=' or line feeds; values must
// not contain line feeds. A value with two double quotes in it is read back whole only if it was
// written in quotes.
//
// The new content is written to "szFile.tmp.XXXXXX" in the same directory. That file gets the
// owner, group and mode of szFile and then replaces it. A reader sees all of a change or nothing,
// and no change of another caller is lost. A symbolic link is itself replaced. A
// link that somebody puts in the place of the new content's file is not followed.
//
// The change is not synced to stable storage. After a power cut, the file may be the old one or the
// new one, empty, a part of the new one, or the new one with the mode and owner of the temporary
// file. Thread cancellation is disabled meanwhile and always enabled on return.
//
// Return 0, or -1 with the file unchanged if it cannot be read, or if it cannot be replaced by a
// file of the same owner (a process without privileges cannot give files to others). Return 0 at
// once if there is nothing to set or remove.
int KiFileSetVal(const char* szFile, const char* szKey, const char* szVal, bool blQuoteVal);
int KiFileSetVals(const char* szFile, const std::map<std::string, std::string>& NewKeyVals,
                  bool blQuoteVal);
int KiFileRemoveKey(const char* szFile, const char* szKey);
int KiFileRemoveKeys(const char* szFile, const std::set<std::string>& Keys);

// Creates an empty file of mode 0600 with a unique name: szTemplate, ".tmp." and six characters.
// Returns the name, or an empty string after logging the reason. The caller removes the file.
std::string CreateTmpFile(const char* szTemplate);

// The platform's core library: keys of capability files, and the banner.
//
// A capability file is a text file of lines "key = value". Blanks (space, tab) around key and value
// and a carriage return at the end of the line do not count, and neither does one pair of double
// quotes around the value. Of several lines with one key the first counts. A line that starts with
// '#' or has no '=' is never a key.
//
// Only regular files of up to 16 MiB, or links to them, are ever opened; anything else holds no
// keys. A changed file is replaced as a whole: whatever happens, the path leads to the old or to
// the new content, with the owner, group and mode it had, and the new one is on stable storage
// before a call returns success, unless the file system cannot sync a directory. Until it gets its
// name it is .zamoc.tmp beside the file; one that a killed process leaves holds no keys, and goes
// with the next change in its directory. Callers that change files of one directory, in any
// process, take turns and wait up to ten seconds for theirs. Why a file could not be read or
// changed goes to syslog at LOG_ERR. Any thread may call any of these.
#pragma once

#include <cstddef>
#include <string>

// One reading of a capability file. While an object lives, ZAMOCFileGetKeyValue of the same path,
// in the same thread, answers from it, whatever becomes of the file: all keys are of one moment. A
// file that could not be read has no keys at all. Without an object every call reads the file.
// Changes do so always. An object is an automatic variable of one thread.
class ZAMOCReading {
 public:
  // Reads the file, and reports a failure.
  explicit ZAMOCReading(const std::string& strFile);
  ~ZAMOCReading();
  ZAMOCReading(const ZAMOCReading&) = delete;
  ZAMOCReading& operator=(const ZAMOCReading&) = delete;

  // The calling thread's latest living object for that path, or null.
  static const ZAMOCReading* Find(const char* szFile);

  // As ZAMOCFileGetKeyValue below; no pointer is null and Size is not 0.
  int GetKeyValue(const char* szKey, char* szValue, size_t Size) const;

 private:
  static thread_local const ZAMOCReading* m_pInnermost;
  const std::string m_strFile;
  const ZAMOCReading* const m_pOuter;
  std::string m_strText;
  bool m_blRead = false;
};

// Copies the value of szKey to szValue, a buffer of Size bytes; a longer value is cut, and the copy
// is always terminated. Returns the value's whole length, 0 when the key is absent or its value
// empty, -1 when the file cannot be read (szValue is then empty). Flags are not used.
int ZAMOCFileGetKeyValue(const char* szFile, const char* szKey, char* szValue, size_t Size,
                         int Flags);

// Sets szKey to szValue in an existing file: its first line is replaced by szFormat with its two
// "%s" filled, further lines of the key are dropped, a new key is appended. All other bytes of the
// file stay. Returns 0, or -1 with the file as it was, unless all that failed was syncing the
// directory behind the replacement. It fails also when key, value and format do not make one line,
// closed by a line feed, of that key.
int ZAMOCFileSetKeyValue(const char* szFile, const char* szKey, const char* szValue,
                         const char* szFormat);

// Takes every line of szKey out of the file. Returns 1 when it did, 0 when there was none and the
// file was left untouched, -1 on failure, as above.
int ZAMOCFileRemoveKey(const char* szFile, const char* szKey);

// One change of a file: szKey is set to szValue in szFormat, or taken out when szValue is null.
struct ZAMOCKeyChange {
  const char* szKey;
  const char* szValue;
  const char* szFormat;
};

// Makes Count changes of different keys, each as the calls above would, in one replacement of the
// file: all of them are made or none. Returns 0, or -1 on failure, as above.
int ZAMOCFileChangeKeys(const char* szFile, const ZAMOCKeyChange* pChanges, size_t Count);

// Writes the program's banner, one line that its build defines as ZAMOC_BANNER, to standard output.
void ZAMOCCopyright();

// The platform's core library: reads and changes keys of capability files, and prints the banner.
//
// A capability file is a text file with lines "key = value". These do not belong to key or value:
// blanks (space, tab) around them, a carriage return at the end of the line, and one pair of double
// quotes around the value. If several lines have the same key, the first line counts. A line that
// starts with '#' or has no '=' has no key.
//
// The library opens only regular files of up to 16 MiB and symbolic links to them. Any other file
// has no keys.
//
// A change replaces the whole file. Even after a crash, the path leads to the old content or to the
// new, with the same owner, group and mode. The new content is on stable storage before a call
// returns success, unless the file system cannot sync a directory. The new file is first written as
// .zamoc.tmp in the same directory. If a killed process leaves one, it has no keys, and the next
// change in the directory removes it.
//
// An advisory lock on the directory serializes changes of its files in all processes. A call waits
// up to ten seconds for the lock. If a file cannot be read or changed, the reason goes to syslog at
// LOG_ERR. Any thread may call any function.
#pragma once

#include <cstddef>
#include <string>

// A snapshot of a capability file. While the object lives, ZAMOCFileGetKeyValue reads the keys of
// that path, in the same thread, from the snapshot, even if the file changes. If the file could not
// be read, the snapshot has no keys. Without a snapshot, every call reads the file. Functions that
// change keys always read the file. An object must be an automatic variable and belongs to one
// thread.
class ZAMOCReading {
 public:
  // Reads the file. Reports a failure to syslog.
  explicit ZAMOCReading(const std::string& strFile);
  ~ZAMOCReading();
  ZAMOCReading(const ZAMOCReading&) = delete;
  ZAMOCReading& operator=(const ZAMOCReading&) = delete;

  // Returns the calling thread's most recent snapshot of that path, or null.
  static const ZAMOCReading* Find(const char* szFile);

  // Works like ZAMOCFileGetKeyValue below. No pointer may be null, and Size must not be 0.
  int GetKeyValue(const char* szKey, char* szValue, size_t Size) const;

 private:
  static thread_local const ZAMOCReading* m_pInnermost;
  const std::string m_strFile;
  const ZAMOCReading* const m_pOuter;
  std::string m_strText;
  bool m_blRead = false;
};

// Copies the value of szKey to szValue, a buffer of Size bytes. Truncates a longer value; always
// terminates the copy. Returns the full length of the value, 0 if the key is absent or its value is
// empty, or -1 if the file cannot be read (szValue is then empty). Flags is ignored.
int ZAMOCFileGetKeyValue(const char* szFile, const char* szKey, char* szValue, size_t Size,
                         int Flags);

// Sets szKey to szValue in an existing file. The new line is szFormat with its two "%s" replaced by
// key and value. It replaces the first line of the key, or is appended if the key has none.
// Repeated lines of the key are dropped. All other bytes of the file are kept. Returns 0, or -1 on
// failure. The file is then unchanged, unless only the sync of the directory after the replacement
// failed. The call also fails if key, value and format do not form one line of that key that ends
// in a line feed.
int ZAMOCFileSetKeyValue(const char* szFile, const char* szKey, const char* szValue,
                         const char* szFormat);

// Removes every line of szKey from the file. Returns 1 if it removed any, 0 if there was none and
// the file is untouched, or -1 on failure, as above.
int ZAMOCFileRemoveKey(const char* szFile, const char* szKey);

// One change of a file: sets szKey to szValue in szFormat, or removes szKey if szValue is null.
struct ZAMOCKeyChange {
  const char* szKey;
  const char* szValue;
  const char* szFormat;
};

// Makes Count changes in one replacement of the file: all of them or none. Each change has the
// effect of the calls above; the keys must differ. Returns 0, or -1 on failure, as above.
int ZAMOCFileChangeKeys(const char* szFile, const ZAMOCKeyChange* pChanges, size_t Count);

// Prints the program's banner, one line, to standard output. The build defines its text as
// ZAMOC_BANNER.
void ZAMOCCopyright();

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
// An advisory lock on the directory serializes changes of its files in all processes. A change
// waits up to ten seconds for the lock. If a file cannot be read or changed, the reason goes to
// syslog at LOG_ERR. A request to cancel the thread waits until a call ends.
#pragma once

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

#include "caplines.h"

// The time for which changes may wait for locks: ten seconds altogether. Must not be used by two
// threads at a time.
class ZAMOCPatience {
 public:
  // Acquires an exclusive lock on the open directory Fd. Returns 0, or -1 with errno. Tries once if
  // the time is over.
  int Lock(int Fd);

 private:
  int64_t m_LeftMsec = 10000;
};

// Makes a new text of a capability file from its present one.
using ZAMOCTextChange = std::function<std::string(const std::string& strText)>;

// Replaces the text of strFile by what Change makes of it, under the lock. Leaves the file alone if
// that is the same. Returns an empty string, or the reason for a failure; the file is then
// unchanged, unless only the sync of the directory after the replacement failed. Sets
// *pStayedLocked to true if the directory stayed locked.
std::string ZAMOCChangeText(const std::string& strFile, ZAMOCPatience* pPatience,
                            const ZAMOCTextChange& Change, bool* pStayedLocked);

// One capability file: its keys when the object was made, and the changes to make. Must not be used
// by two threads at a time.
class ZAMOCFile {
 public:
  // Reads the file. If it cannot be read, the object has no keys. *pPatience must outlive the
  // object.
  ZAMOCFile(std::string strFile, ZAMOCPatience* pPatience);
  ZAMOCFile(const ZAMOCFile&) = delete;
  ZAMOCFile& operator=(const ZAMOCFile&) = delete;

  // The value of strKey as the file had it; empty if the key is absent.
  std::string Get(const std::string& strKey) const;

  // Notes that Save sets strKey to strValue. The new line is strFormat with its two "%s" replaced
  // by key and value. It replaces the first line of the key, or is appended if the key has none.
  // Repeated lines of the key are dropped. All other bytes of the file are kept.
  void Set(const std::string& strKey, const std::string& strValue, const std::string& strFormat);

  // Notes that Save removes every line of strKey.
  void Remove(const std::string& strKey);

  // Makes the noted changes in one replacement of the file: all of them or none. They apply to what
  // the file contains now, under the lock. Leaves the file alone if nothing would change. If a key
  // was noted twice, the later change counts.
  //
  // Returns 0, or -1 on failure. The file is then unchanged, unless only the sync of the directory
  // after the replacement failed. It is a failure if a key, its value and its format do not form
  // one line of that key that ends in a line feed, or if there are changes and the file was not
  // read.
  int Save();

  // Why the file could not be read, or why Save has last failed; empty if neither. A path that
  // cannot lead to a capability file (missing, a directory, ...) is an error for Save only.
  const std::string& Error() const { return m_strError; }

  // True if Save has failed because the directory stayed locked.
  bool StayedLocked() const { return m_blStayedLocked; }

 private:
  void Note(const std::string& strKey, const std::string& strNewLine);

  const std::string m_strFile;
  ZAMOCPatience* const m_pPatience;
  std::string m_strText;
  std::string m_strUnread;  // why it was not read; empty if it was
  std::string m_strError;
  bool m_blStayedLocked = false;
  bool m_blValid = true;  // all changes form a line
  std::vector<caplines::Change> m_Changes;
};

// Prints the program's banner, one line, to standard output. The build defines its text as
// ZAMOC_BANNER.
void ZAMOCCopyright();

// A whole capability file: reads it, and replaces it so that even a crash leaves the old content or
// the new. zamoc.h describes the files. No function reports a failure; any thread may call any
// function.
#pragma once

#include <sys/stat.h>

#include <optional>
#include <string>
#include <string_view>

#include "fileops.h"

namespace capfile {

enum class ReadResult {
  Read,
  NoCapabilityFile,  // the file cannot be a capability file; no failure
  OpenFailed,
  ReadFailed,
};

// Reads the content of a file and, if pStat is not null, the status of the opened file. If the
// result is not Read, errno gives the reason, and the content is not usable.
ReadResult Read(const std::string& strFile, std::string* pText, struct stat* pStat);

// The right to change a file: an advisory lock on its directory, until the object dies. A symbolic
// link stays; the file that it leads to is changed. If a function returns -1, errno gives the
// reason and Step() what failed.
class LockedFile {
 public:
  LockedFile() = default;

  // Waits up to ten seconds for the lock. Returns 0 or -1. Call it first, and once.
  int Lock(const char* szFile);

  // The file, behind any link.
  const std::string& Name() const { return m_strFile; }

  // Replaces the file, or creates it, with the owner, group and mode of Stat. Returns 0 once the
  // new content is on stable storage, or -1. The file is then unchanged, unless only the sync of
  // the directory failed.
  int Replace(std::string_view Text, const struct stat& Stat);

  // Removes the file. Returns 0 once that is on stable storage, or -1.
  int Remove();

  const char* Step() const { return m_szStep; }

 private:
  int Fail(const char* szStep);
  int SyncDirectory();

  std::string m_strFile;
  std::string m_strDir;
  std::optional<fileops::Descriptor> m_Dir;
  const char* m_szStep = "";
};

}  // namespace capfile

#include "zamoc.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "caplines.h"
#include "kiflock.h"

using caplines::Change;
using caplines::ChangeLines;
using caplines::FindKey;
using caplines::FormatLine;

namespace {

constexpr int DIR_LOCK_TIMEOUT_SEC = 10;
constexpr off_t MAX_FILE_SIZE = off_t{16} * 1024 * 1024;
constexpr const char* TMP_NAME = "/.zamoc.tmp";
constexpr const char* OPEN_STEP = "open";

// --- Files ---

class Descriptor {
 public:
  explicit Descriptor(int Fd) : m_Fd(Fd) {}
  ~Descriptor() {
    const int Errno = errno;  // what made the caller give up
    if (m_Fd != -1) {
      close(m_Fd);
    }
    errno = Errno;
  }
  Descriptor(const Descriptor&) = delete;
  Descriptor& operator=(const Descriptor&) = delete;
  int Get() const { return m_Fd; }

 private:
  const int m_Fd;
};

// A file that disappears with the object unless it was given its final name. Only whoever holds the
// directory's lock makes one, so one that is already there was left behind by a killed process.
class TmpFile {
 public:
  explicit TmpFile(const std::string& strDir) : m_strName(strDir + TMP_NAME) {
    m_Fd = Create();
    if (m_Fd == -1 && errno == EEXIST && unlink(m_strName.c_str()) == 0) {
      m_Fd = Create();
    }
    m_blUnnamed = m_Fd != -1;
  }
  ~TmpFile() {
    if (m_Fd != -1) {
      close(m_Fd);
    }
    if (m_blUnnamed) {
      unlink(m_strName.c_str());
    }
  }
  TmpFile(const TmpFile&) = delete;
  TmpFile& operator=(const TmpFile&) = delete;

  // -1 when it could not be created.
  int Get() const { return m_Fd; }

  int RenameTo(const std::string& strName) {
    if (rename(m_strName.c_str(), strName.c_str()) != 0) {
      return -1;
    }
    m_blUnnamed = false;
    return 0;
  }

 private:
  int Create() const {
    return open(m_strName.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
  }

  const std::string m_strName;
  int m_Fd = -1;
  bool m_blUnnamed = false;  // it is there, and has only its temporary name
};

// What a killed process left behind is nobody's capability file: the next change in its directory
// removes it.
bool IsTmpFile(const std::string& strFile) {
  const std::string strEnd = TMP_NAME;
  return strFile.size() >= strEnd.size() &&
         strFile.compare(strFile.size() - strEnd.size(), strEnd.size(), strEnd) == 0;
}

// 0 when it can be a capability file, else -1 with errno.
int CheckFile(const struct stat& Stat) {
  if (!S_ISREG(Stat.st_mode)) {
    errno = EINVAL;
    return -1;
  }
  if (Stat.st_size > MAX_FILE_SIZE) {
    errno = EFBIG;
    return -1;
  }
  return 0;
}

// Reads a file to its end. Returns 0, or -1 with errno, also when it grows too large.
int ReadAll(int Fd, std::string* pText) {
  char rgBuf[16384];
  ssize_t Len;
  pText->clear();
  while ((Len = read(Fd, rgBuf, sizeof(rgBuf))) > 0) {
    pText->append(rgBuf, static_cast<size_t>(Len));
    if (pText->size() > static_cast<size_t>(MAX_FILE_SIZE)) {
      errno = EFBIG;
      return -1;
    }
  }
  return Len == 0 ? 0 : -1;
}

// The file that the thread read last: mostly one key after the other is asked for. It is empty when
// a further change of the file might not show in its status.
struct LAST_FILE {
  struct stat Stat;
  std::string strText;
};
thread_local LAST_FILE gLastFile;

bool IsEqual(const timespec& A, const timespec& B) {
  return A.tv_sec == B.tv_sec && A.tv_nsec == B.tv_nsec;
}

bool IsUnchanged(const struct stat& Then, const struct stat& Now) {
  return Then.st_ino == Now.st_ino && Then.st_dev == Now.st_dev && Then.st_size == Now.st_size &&
         IsEqual(Then.st_mtim, Now.st_mtim) && IsEqual(Then.st_ctim, Now.st_ctim);
}

// Whether a change from now on would get another time: the clock that files get theirs from has
// moved on, by two seconds where a file system counts whole ones.
bool IsSettled(const struct stat& Stat) {
  timespec Now;
  clock_gettime(CLOCK_REALTIME_COARSE, &Now);
  const int64_t AgeNsec = (int64_t{Now.tv_sec} - Stat.st_ctim.tv_sec) * 1000000000 +
                          (Now.tv_nsec - Stat.st_ctim.tv_nsec);
  return AgeNsec > (Stat.st_ctim.tv_nsec == 0 ? 2000000000 : 0);
}

// Returns the text of a capability file, valid until the thread's next call, and the file's status
// in *pStat; or null with errno and in *pszStep what failed.
//
// Opening anything but a regular file could hang (a FIFO) or have effects (a device), so it is
// looked at first, and again once open.
const std::string* ReadFile(const char* szFile, struct stat* pStat, const char** pszStep) {
  *pszStep = OPEN_STEP;
  if (stat(szFile, pStat) != 0 || CheckFile(*pStat) != 0) {
    return nullptr;
  }
  if (IsTmpFile(szFile)) {
    errno = EINVAL;
    return nullptr;
  }
  if (IsUnchanged(gLastFile.Stat, *pStat)) {
    return &gLastFile.strText;
  }
  gLastFile.Stat = {};
  const Descriptor File(open(szFile, O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
  if (File.Get() == -1 || fstat(File.Get(), pStat) != 0 || CheckFile(*pStat) != 0) {
    return nullptr;
  }
  const bool blSettled = IsSettled(*pStat);
  *pszStep = "read";
  if (ReadAll(File.Get(), &gLastFile.strText) != 0) {
    return nullptr;
  }
  if (blSettled && gLastFile.strText.size() == static_cast<size_t>(pStat->st_size)) {
    gLastFile.Stat = *pStat;
  }
  return &gLastFile.strText;
}

int WriteAll(int Fd, std::string_view Text) {
  while (!Text.empty()) {
    const ssize_t Len = write(Fd, Text.data(), Text.size());
    if (Len == -1) {
      return -1;
    }
    Text.remove_prefix(static_cast<size_t>(Len));
  }
  return 0;
}

// Whether it is the name, and no failure, that kept ReadFile from opening.
bool HoldsNoKeys(const char* szStep, int Errno) {
  return szStep == OPEN_STEP &&
         (Errno == EINVAL || Errno == EFBIG || Errno == ENOENT || Errno == ELOOP);
}

// --- Changes ---

int ReportFailure(const char* szFile, const char* szStep) {
  const int Errno = errno;
  syslog(LOG_ERR, "zamoc: [%s]: %s failed with errno [%d]", szFile, szStep, Errno);
  errno = Errno;
  return -1;
}

int SetOwnerAndMode(int Fd, const struct stat& Stat) {
  if (fchown(Fd, Stat.st_uid, Stat.st_gid) != 0) {
    return -1;
  }
  return fchmod(Fd, Stat.st_mode & 07777);
}

// Replaces the file strReal in the directory behind DirFd by its changed copy. The order makes it
// hold through a power cut: the content is on stable storage before it gets its name.
int ReplaceFile(const std::string& strReal, const std::string& strDir, int DirFd,
                const std::vector<Change>& Changes) {
  const char* szFile = strReal.c_str();
  const char* szStep;
  struct stat Stat;
  const std::string* pText = ReadFile(szFile, &Stat, &szStep);
  if (pText == nullptr) {
    return ReportFailure(szFile, szStep);
  }
  TmpFile New(strDir);
  if (New.Get() == -1) {
    return ReportFailure(szFile, "creation of a temporary file");
  }
  if (WriteAll(New.Get(), ChangeLines(*pText, Changes)) != 0) {
    return ReportFailure(szFile, "copy");
  }
  if (SetOwnerAndMode(New.Get(), Stat) != 0) {
    return ReportFailure(szFile, "copy of owner and mode");
  }
  if (fsync(New.Get()) != 0) {
    return ReportFailure(szFile, "fsync");
  }
  if (New.RenameTo(strReal) != 0) {
    return ReportFailure(szFile, "rename");
  }
  // Some file systems cannot sync a directory, and say so; that is no failure.
  if (fsync(DirFd) != 0 && errno != EINVAL) {
    return ReportFailure(szFile, "fsync of the directory");
  }
  return 0;
}

bool IsLink(const char* szFile) {
  struct stat Stat;
  return lstat(szFile, &Stat) == 0 && S_ISLNK(Stat.st_mode);
}

int ChangeFile(const char* szFile, const std::vector<Change>& Changes) {
  std::string strReal = szFile;
  if (strReal.find('/') == std::string::npos || IsLink(szFile)) {
    // A link stays: the file it leads to is the one that is replaced.
    const std::unique_ptr<char, decltype(&free)> pReal(realpath(szFile, nullptr), free);
    if (pReal == nullptr) {
      return ReportFailure(szFile, "realpath");
    }
    strReal = pReal.get();
  }
  const std::string strDir = strReal.substr(0, std::max<size_t>(strReal.rfind('/'), 1));
  const Descriptor Dir(open(strDir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (Dir.Get() == -1) {
    return ReportFailure(szFile, "open of the directory");
  }
  // Two changes made at once must not undo each other.
  if (KiFlock::Lock(Dir.Get(), DIR_LOCK_TIMEOUT_SEC, true) != 0) {
    return ReportFailure(szFile, "lock of the directory");
  }
  return ReplaceFile(strReal, strDir, Dir.Get(), Changes);
}

}  // namespace

int ZAMOCFileGetKeyValue(const char* szFile, const char* szKey, char* szValue, size_t Size,
                         int /*Flags*/) {
  if (szFile == nullptr || szKey == nullptr || szValue == nullptr || Size == 0) {
    return -1;
  }
  szValue[0] = '\0';
  const char* szStep;
  struct stat Stat;
  const std::string* pText = ReadFile(szFile, &Stat, &szStep);
  if (pText == nullptr) {
    return HoldsNoKeys(szStep, errno) ? -1 : ReportFailure(szFile, szStep);
  }
  std::string_view Value;
  if (!FindKey(*pText, szKey, &Value)) {
    return 0;
  }
  szValue[Value.copy(szValue, Size - 1)] = '\0';
  return static_cast<int>(Value.size());
}

int ZAMOCFileChangeKeys(const char* szFile, const ZAMOCKeyChange* pChanges, size_t Count) {
  if (szFile == nullptr || pChanges == nullptr) {
    return -1;
  }
  std::vector<Change> Changes;
  for (const ZAMOCKeyChange* pChange = pChanges; pChange != pChanges + Count; ++pChange) {
    Change New;
    New.strKey = pChange->szKey == nullptr ? "" : pChange->szKey;
    if (pChange->szValue != nullptr && pChange->szFormat != nullptr) {
      New.strNewLine = FormatLine(pChange->szFormat, New.strKey, pChange->szValue);
    }
    if (New.strKey.empty() || New.strNewLine.empty() != (pChange->szValue == nullptr)) {
      errno = EINVAL;
      return ReportFailure(szFile, "change of a key");
    }
    Changes.push_back(New);
  }
  return ChangeFile(szFile, Changes);
}

int ZAMOCFileSetKeyValue(const char* szFile, const char* szKey, const char* szValue,
                         const char* szFormat) {
  const ZAMOCKeyChange Change = {szKey, szValue == nullptr ? "" : szValue, szFormat};
  return ZAMOCFileChangeKeys(szFile, &Change, 1);
}

int ZAMOCFileRemoveKey(const char* szFile, const char* szKey) {
  if (szFile == nullptr || szKey == nullptr) {
    return -1;
  }
  const char* szStep;
  struct stat Stat;
  const std::string* pText = ReadFile(szFile, &Stat, &szStep);
  if (pText == nullptr) {
    return ReportFailure(szFile, szStep);
  }
  std::string_view Value;
  if (!FindKey(*pText, szKey, &Value)) {
    return 0;
  }
  const ZAMOCKeyChange Change = {szKey, nullptr, nullptr};
  return ZAMOCFileChangeKeys(szFile, &Change, 1) == 0 ? 1 : -1;
}

void ZAMOCCopyright() { puts(ZAMOC_BANNER); }

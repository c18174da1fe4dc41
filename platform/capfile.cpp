#include "capfile.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <memory>

#include "kiflock.h"

namespace {

constexpr int DIR_LOCK_TIMEOUT_SEC = 10;
constexpr size_t MAX_FILE_SIZE = size_t{16} * 1024 * 1024;
constexpr const char* TMP_NAME = "/.zamoc.tmp";

// True for a temporary file of this unit, which is never a capability file. A killed process may
// leave one; the next change in its directory removes it.
bool IsTmpFile(const std::string& strFile) {
  const std::string strEnd = TMP_NAME;
  return strFile.size() >= strEnd.size() &&
         strFile.compare(strFile.size() - strEnd.size(), strEnd.size(), strEnd) == 0;
}

// Returns 0 if the file can be a capability file, else -1 with errno.
int CheckFile(const struct stat& Stat) {
  if (!S_ISREG(Stat.st_mode)) {
    errno = EINVAL;
    return -1;
  }
  if (Stat.st_size > static_cast<off_t>(MAX_FILE_SIZE)) {
    errno = EFBIG;
    return -1;
  }
  return 0;
}

// Checks the file before opening it, because opening a FIFO could hang and opening a device could
// have side effects. Returns a descriptor and sets *pSize to the file's size, or returns -1 with
// errno.
int OpenCapabilityFile(const std::string& strFile, size_t* pSize) {
  if (IsTmpFile(strFile)) {
    errno = EINVAL;
    return -1;
  }
  struct stat Stat;
  if (stat(strFile.c_str(), &Stat) != 0 || CheckFile(Stat) != 0) {
    return -1;
  }
  *pSize = static_cast<size_t>(Stat.st_size);
  return open(strFile.c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC);
}

// Reads a file to its end. Size is its expected size. Returns 0, or -1 with errno; a file that has
// grown too large gives EFBIG.
int ReadAll(int Fd, size_t Size, std::string* pText) {
  size_t Len = 0;
  pText->resize(Size + 1);  // one more byte, so that one read shows the end too
  for (;;) {
    const ssize_t Count = read(Fd, pText->data() + Len, pText->size() - Len);
    if (Count == -1) {
      return -1;
    }
    Len += static_cast<size_t>(Count);
    if (Len > MAX_FILE_SIZE) {
      errno = EFBIG;
      return -1;
    }
    if (Count == 0 || Len == Size) {
      pText->resize(Len);
      return 0;
    }
    if (Len == pText->size()) {
      pText->resize(2 * Len);
    }
  }
}

int SetOwnerAndMode(int Fd, const struct stat& Stat) {
  if (fchown(Fd, Stat.st_uid, Stat.st_gid) != 0) {
    return -1;
  }
  return fchmod(Fd, Stat.st_mode & 07777);
}

bool IsLink(const char* szFile) {
  struct stat Stat;
  return lstat(szFile, &Stat) == 0 && S_ISLNK(Stat.st_mode);
}

}  // namespace

namespace capfile {

ReadResult Read(const std::string& strFile, std::string* pText, struct stat* pStat) {
  size_t Size = 0;
  const fileops::Descriptor File(OpenCapabilityFile(strFile, &Size));
  if (File.Get() == -1 ||
      (pStat != nullptr && (fstat(File.Get(), pStat) != 0 || CheckFile(*pStat) != 0))) {
    const bool blByName = errno == EINVAL || errno == EFBIG || errno == ENOENT || errno == ELOOP;
    return blByName ? ReadResult::NoCapabilityFile : ReadResult::OpenFailed;
  }
  return ReadAll(File.Get(), Size, pText) == 0 ? ReadResult::Read : ReadResult::ReadFailed;
}

int LockedFile::Fail(const char* szStep) {
  m_szStep = szStep;
  return -1;
}

int LockedFile::Lock(const char* szFile) {
  m_strFile = szFile;
  if (m_strFile.find('/') == std::string::npos || IsLink(szFile)) {
    const std::unique_ptr<char, decltype(&free)> pReal(realpath(szFile, nullptr), free);
    if (pReal == nullptr) {
      return Fail("realpath");
    }
    m_strFile = pReal.get();
  }
  m_strDir = m_strFile.substr(0, std::max<size_t>(m_strFile.rfind('/'), 1));
  m_Dir.emplace(open(m_strDir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (m_Dir->Get() == -1) {
    return Fail("open of the directory");
  }
  // Concurrent changes must not undo each other.
  if (KiFlock::Lock(m_Dir->Get(), DIR_LOCK_TIMEOUT_SEC, true) != 0) {
    return Fail("lock of the directory");
  }
  return 0;
}

int LockedFile::Replace(std::string_view Text, const struct stat& Stat) {
  const std::string strNew = m_strDir + TMP_NAME;
  const fileops::Descriptor New(fileops::CreateAnew(strNew.c_str()));
  if (New.Get() == -1) {
    return Fail("creation of a temporary file");
  }
  fileops::TmpFile NewName(strNew);
  if (fileops::WriteAll(New.Get(), Text.data(), Text.size()) != 0) {
    return Fail("copy");
  }
  if (SetOwnerAndMode(New.Get(), Stat) != 0) {
    return Fail("copy of owner and mode");
  }
  if (fsync(New.Get()) != 0) {
    return Fail("fsync");
  }
  if (NewName.RenameTo(m_strFile.c_str()) != 0) {
    return Fail("rename");
  }
  return SyncDirectory();
}

int LockedFile::Remove() {
  return unlink(m_strFile.c_str()) == 0 ? SyncDirectory() : Fail("unlink");
}

int LockedFile::SyncDirectory() {
  // EINVAL: this file system cannot sync a directory. That is no failure.
  return fsync(m_Dir->Get()) == 0 || errno == EINVAL ? 0 : Fail("fsync of the directory");
}

}  // namespace capfile

#include "zamoc.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "caplines.h"
#include "fileops.h"
#include "kiflock.h"

using caplines::Change;
using caplines::ChangeLines;
using caplines::FindKey;
using caplines::FormatLine;

namespace {

constexpr size_t MAX_FILE_SIZE = size_t{16} * 1024 * 1024;
constexpr const char* TMP_NAME = "/.zamoc.tmp";

// --- Reading ---

enum class ReadResult {
  Read,
  NoCapabilityFile,  // missing, a loop of links, or of another kind; no failure
  TooLarge,
  OpenFailed,  // with errno
  ReadFailed,  // with errno
};

// True for a temporary file of this library, which is never a capability file. A killed process may
// leave one; the next change in its directory removes it.
bool IsTmpFile(const std::string& strFile) {
  const std::string strEnd = TMP_NAME;
  return strFile.size() >= strEnd.size() &&
         strFile.compare(strFile.size() - strEnd.size(), strEnd.size(), strEnd) == 0;
}

// Read if the file can be read.
ReadResult CheckFile(const struct stat& Stat) {
  if (!S_ISREG(Stat.st_mode)) {
    return ReadResult::NoCapabilityFile;
  }
  return Stat.st_size > static_cast<off_t>(MAX_FILE_SIZE) ? ReadResult::TooLarge : ReadResult::Read;
}

// The result of a stat or an open that failed.
ReadResult NotOpened() {
  return errno == ENOENT || errno == ELOOP ? ReadResult::NoCapabilityFile : ReadResult::OpenFailed;
}

// Reads a file to its end. Size is its expected size.
ReadResult ReadAll(int Fd, size_t Size, std::string* pText) {
  size_t Len = 0;
  pText->resize(Size + 1);  // one more byte, so that one read shows the end too
  for (;;) {
    const ssize_t Count = read(Fd, pText->data() + Len, pText->size() - Len);
    if (Count == -1 && errno == EINTR) {
      continue;
    }
    if (Count == -1) {
      return ReadResult::ReadFailed;
    }
    Len += static_cast<size_t>(Count);
    if (Len > MAX_FILE_SIZE) {
      return ReadResult::TooLarge;
    }
    if (Count == 0 || Len == Size) {
      pText->resize(Len);
      return ReadResult::Read;
    }
    if (Len == pText->size()) {
      pText->resize(2 * Len);
    }
  }
}

// Reads the text of a capability file and, if pStat is not null, the status of the opened file.
// Unless the result is Read, the text is not usable.
ReadResult ReadFile(const std::string& strFile, std::string* pText, struct stat* pStat) {
  if (IsTmpFile(strFile)) {
    return ReadResult::NoCapabilityFile;
  }
  // Check the file before opening it: to open a FIFO could hang, and to open a device could have
  // side effects.
  struct stat Named;
  if (stat(strFile.c_str(), &Named) != 0) {
    return NotOpened();
  }
  ReadResult Result = CheckFile(Named);
  if (Result != ReadResult::Read) {
    return Result;
  }
  const fileops::Descriptor File(
      open(strFile.c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
  if (File.Get() == -1) {
    return NotOpened();
  }
  if (pStat != nullptr) {
    if (fstat(File.Get(), pStat) != 0) {
      return ReadResult::OpenFailed;
    }
    Result = CheckFile(*pStat);
    if (Result != ReadResult::Read) {
      return Result;
    }
  }
  return ReadAll(File.Get(), static_cast<size_t>(Named.st_size), pText);
}

// The reason for a failed step, from errno.
std::string Reason(const char* szStep) {
  const char* const szReason = strerror(errno);
  return std::string(szStep) + ": " + szReason;
}

// Why the file has not been read; empty if it has.
std::string Reason(ReadResult Result) {
  switch (Result) {
    case ReadResult::Read:
      return "";
    case ReadResult::NoCapabilityFile:
      return "no capability file";
    case ReadResult::TooLarge:
      return "larger than 16 MiB";
    case ReadResult::OpenFailed:
      return Reason("open");
    case ReadResult::ReadFailed:
      return Reason("read");
  }
  return "";
}

// --- Changes ---

int SetOwnerAndMode(int Fd, const struct stat& Stat) {
  if (fchown(Fd, Stat.st_uid, Stat.st_gid) != 0) {
    return -1;
  }
  return fchmod(Fd, Stat.st_mode & 07777);
}

// Returns the reason for a failure, else an empty string.
std::string SyncDir(int DirFd) {
  // EINVAL: this file system cannot sync a directory. That is no failure.
  return fsync(DirFd) == 0 || errno == EINVAL ? "" : Reason("fsync of the directory");
}

// Replaces strFile with a changed copy, unless nothing changes. DirFd is its open directory. The
// copy is on stable storage before it gets the file's name, so that a power cut leaves the old
// content or the new. Returns the reason for a failure, else an empty string.
std::string ReplaceFile(const std::string& strFile, const std::string& strDir, int DirFd,
                        const ZAMOCTextChange& Change) {
  std::string strText;
  struct stat Stat;
  const ReadResult Result = ReadFile(strFile, &strText, &Stat);
  if (Result != ReadResult::Read) {
    return Reason(Result);
  }
  const std::string strNewText = Change(strText);
  if (strNewText == strText) {
    return SyncDir(DirFd);  // who has written this may have been killed before
  }
  std::string strNew = strDir + TMP_NAME;
  const fileops::Descriptor New(fileops::CreateAnew(strNew.c_str()));
  if (New.Get() == -1) {
    return Reason("creation of a temporary file");
  }
  fileops::TmpFile NewName(std::move(strNew));  // a copy could fail and leave the file behind
  if (fileops::WriteAll(New.Get(), strNewText.data(), strNewText.size()) != 0) {
    return Reason("copy");
  }
  if (SetOwnerAndMode(New.Get(), Stat) != 0) {
    return Reason("copy of owner and mode");
  }
  if (fsync(New.Get()) != 0) {
    return Reason("fsync");
  }
  if (NewName.RenameTo(strFile.c_str()) != 0) {
    return Reason("rename");
  }
  return SyncDir(DirFd);
}

bool IsLink(const std::string& strFile) {
  struct stat Stat;
  return lstat(strFile.c_str(), &Stat) == 0 && S_ISLNK(Stat.st_mode);
}

}  // namespace

int ZAMOCPatience::Lock(int Fd) {
  if (KiFlock::Lock(Fd, 0, true) == 0) {
    return 0;
  }
  const auto Start = std::chrono::steady_clock::now();
  const int Err = KiFlock::Lock(Fd, static_cast<int>(m_LeftMsec / 1000), true);
  const auto Waited = std::chrono::steady_clock::now() - Start;
  m_LeftMsec -= std::chrono::duration_cast<std::chrono::milliseconds>(Waited).count();
  m_LeftMsec = std::max<int64_t>(m_LeftMsec, 0);
  return Err;
}

std::string ZAMOCChangeText(const std::string& strFile, ZAMOCPatience* pPatience,
                            const ZAMOCTextChange& Change, bool* pStayedLocked) {
  const fileops::NoCancel Guard;  // a cancelled call would lose a descriptor or leave a file
  std::string strReal = strFile;
  if (strReal.find('/') == std::string::npos || IsLink(strFile)) {
    // Keep a symbolic link and replace the file that it leads to.
    const std::unique_ptr<char, decltype(&free)> pReal(realpath(strFile.c_str(), nullptr), free);
    if (pReal == nullptr) {
      return Reason("realpath");
    }
    strReal = pReal.get();
  }
  const std::string strDir = strReal.substr(0, std::max<size_t>(strReal.rfind('/'), 1));
  const fileops::Descriptor Dir(open(strDir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (Dir.Get() == -1) {
    return Reason("open of the directory");
  }
  // Concurrent changes must not undo each other.
  *pStayedLocked = pPatience->Lock(Dir.Get()) != 0;
  if (*pStayedLocked) {
    return Reason("lock of the directory");
  }
  return ReplaceFile(strReal, strDir, Dir.Get(), Change);
}

ZAMOCFile::ZAMOCFile(std::string strFile, ZAMOCPatience* pPatience)
    : m_strFile(std::move(strFile)), m_pPatience(pPatience) {
  const fileops::NoCancel Guard;  // a cancelled open would lose its descriptor
  const ReadResult Result = ReadFile(m_strFile, &m_strText, nullptr);
  m_strUnread = Reason(Result);
  if (Result != ReadResult::NoCapabilityFile) {
    m_strError = m_strUnread;
  }
}

std::string ZAMOCFile::Get(const std::string& strKey) const {
  std::string_view Value;
  return m_strUnread.empty() && FindKey(m_strText, strKey, &Value) ? std::string(Value) : "";
}

void ZAMOCFile::Set(const std::string& strKey, const std::string& strValue,
                    const std::string& strFormat) {
  const std::string strNewLine = FormatLine(strFormat, strKey, strValue);
  m_blValid = m_blValid && !strNewLine.empty();
  Note(strKey, strNewLine);
}

void ZAMOCFile::Remove(const std::string& strKey) { Note(strKey, ""); }

void ZAMOCFile::Note(const std::string& strKey, const std::string& strNewLine) {
  m_blValid = m_blValid && !strKey.empty();
  for (Change& Noted : m_Changes) {
    if (Noted.strKey == strKey) {
      Noted.strNewLine = strNewLine;
      return;
    }
  }
  m_Changes.push_back({strKey, strNewLine});
}

int ZAMOCFile::Save() {
  if (m_Changes.empty()) {
    return 0;
  }
  if (!m_blValid) {
    m_strError = "a change does not form one line";
  } else if (!m_strUnread.empty()) {
    m_strError = m_strUnread;
  } else {
    const auto Change = [this](const std::string& strText) {
      return ChangeLines(strText, m_Changes);
    };
    m_strError = ZAMOCChangeText(m_strFile, m_pPatience, Change, &m_blStayedLocked);
  }
  return m_strError.empty() ? 0 : -1;
}

void ZAMOCCopyright() { puts(ZAMOC_BANNER); }

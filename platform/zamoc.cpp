#include "zamoc.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <string>
#include <vector>

#include "kiflock.h"

namespace {

constexpr int DIR_LOCK_TIMEOUT_SEC = 10;
constexpr off_t MAX_FILE_SIZE = off_t{16} * 1024 * 1024;
constexpr const char* BLANKS = " \t";
constexpr const char* TMP_NAME = "/.tesselupgrader.tmp";

// --- Files ---

struct FileCloser {
  void operator()(FILE* pFile) const { fclose(pFile); }
};
using File = std::unique_ptr<FILE, FileCloser>;

class Descriptor {
 public:
  explicit Descriptor(int Fd) : m_Fd(Fd) {}
  ~Descriptor() {
    if (m_Fd != -1) {
      close(m_Fd);
    }
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
    unlink(m_strName.c_str());
    const int Fd = open(m_strName.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
    if (Fd == -1) {
      return;
    }
    m_blCreated = true;
    m_pStream.reset(fdopen(Fd, "w"));
    if (m_pStream == nullptr) {
      close(Fd);
    }
  }
  ~TmpFile() {
    if (m_blCreated) {
      unlink(m_strName.c_str());
    }
  }
  TmpFile(const TmpFile&) = delete;
  TmpFile& operator=(const TmpFile&) = delete;

  // Null when it could not be created.
  FILE* Stream() const { return m_pStream.get(); }

  int RenameTo(const std::string& strName) {
    if (rename(m_strName.c_str(), strName.c_str()) != 0) {
      return -1;
    }
    m_blCreated = false;
    return 0;
  }

 private:
  const std::string m_strName;
  File m_pStream;
  bool m_blCreated = false;
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

// Opening anything but a regular file could hang (a FIFO) or have effects (a device), so it is
// looked at first, and again once open. Null with errno when it cannot be a capability file.
File OpenRegular(const char* szFile) {
  struct stat Stat;
  if (stat(szFile, &Stat) != 0 || CheckFile(Stat) != 0) {
    return nullptr;
  }
  if (IsTmpFile(szFile)) {
    errno = EINVAL;
    return nullptr;
  }
  const int Fd = open(szFile, O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC);
  if (Fd == -1) {
    return nullptr;
  }
  File pFile(fdopen(Fd, "r"));
  if (pFile == nullptr) {
    close(Fd);
    return nullptr;
  }
  if (fstat(Fd, &Stat) != 0 || CheckFile(Stat) != 0) {
    return nullptr;
  }
  return pFile;
}

// Whether it is the name, and no failure, that kept OpenRegular from opening.
bool HoldsNoKeys(int Errno) {
  return Errno == EINVAL || Errno == EFBIG || Errno == ENOENT || Errno == ELOOP;
}

// --- Lines ---

// Reads a file line by line; a line keeps its line feed and may hold any bytes.
class LineReader {
 public:
  explicit LineReader(FILE* pFile) : m_pFile(pFile) {}
  ~LineReader() { free(m_pLine); }
  LineReader(const LineReader&) = delete;
  LineReader& operator=(const LineReader&) = delete;

  // False at the end and on a failure, which Failed() tells apart.
  bool Next(std::string* pLine) {
    const ssize_t Len = getline(&m_pLine, &m_Size, m_pFile);
    if (Len < 0 || ferror(m_pFile) != 0) {
      return false;
    }
    pLine->assign(m_pLine, static_cast<size_t>(Len));
    return true;
  }
  bool Failed() const { return feof(m_pFile) == 0; }

 private:
  FILE* const m_pFile;
  char* m_pLine = nullptr;
  size_t m_Size = 0;
};

std::string TrimBlanks(const std::string& strText) {
  const size_t First = strText.find_first_not_of(BLANKS);
  if (First == std::string::npos) {
    return "";
  }
  return strText.substr(First, strText.find_last_not_of(BLANKS) - First + 1);
}

// The key of a line, empty when it has none.
std::string KeyOf(const std::string& strLine) {
  const size_t Equals = strLine.find('=');
  if (Equals == std::string::npos || strLine[0] == '#') {
    return "";
  }
  return TrimBlanks(strLine.substr(0, Equals));
}

std::string ValueOf(std::string strLine) {
  for (const char LineEnd : {'\n', '\r'}) {
    if (!strLine.empty() && strLine.back() == LineEnd) {
      strLine.pop_back();
    }
  }
  std::string strValue = TrimBlanks(strLine.substr(strLine.find('=') + 1));
  if (strValue.size() >= 2 && strValue.front() == '"' && strValue.back() == '"') {
    strValue = strValue.substr(1, strValue.size() - 2);
  }
  return strValue;
}

// Fills the two "%s" of strFormat. Returns nothing when it has not exactly two, or when they do not
// make one line of that key.
std::string FormatLine(const std::string& strFormat, const std::string& strKey,
                       const std::string& strValue) {
  const size_t Key = strFormat.find("%s");
  const size_t Value = Key == std::string::npos ? Key : strFormat.find("%s", Key + 2);
  if (Value == std::string::npos || std::count(strFormat.begin(), strFormat.end(), '%') != 2) {
    return "";
  }
  std::string strLine = strFormat.substr(0, Key) + strKey +
                        strFormat.substr(Key + 2, Value - Key - 2) + strValue +
                        strFormat.substr(Value + 2);
  const bool blOneLine = strLine.find('\n') == strLine.size() - 1;
  return blOneLine && KeyOf(strLine) == strKey ? strLine : "";
}

// Reads up to the first line of strKey. Returns 1 with its value, 0 when there is none, -1 on
// failure.
int FindKey(FILE* pFile, const std::string& strKey, std::string* pValue) {
  LineReader Reader(pFile);
  std::string strLine;
  while (Reader.Next(&strLine)) {
    if (!strKey.empty() && KeyOf(strLine) == strKey) {
      *pValue = ValueOf(strLine);
      return 1;
    }
  }
  return Reader.Failed() ? -1 : 0;
}

// --- Changes ---

struct CHANGE {
  std::string strKey;
  std::string strNewLine;  // empty: the key is taken out
  bool blFound = false;
};

int ReportFailure(const char* szFile, const char* szStep) {
  const int Errno = errno;
  syslog(LOG_ERR, "zamoc: [%s]: %s failed with errno [%d]", szFile, szStep, Errno);
  errno = Errno;
  return -1;
}

// Copies pOld to pNew, making the changes on the way.
int CopyChanged(FILE* pOld, FILE* pNew, std::vector<CHANGE> Changes) {
  LineReader Reader(pOld);
  std::string strLine;
  bool blLineOpen = false;
  while (Reader.Next(&strLine)) {
    const std::string strKey = KeyOf(strLine);
    const auto Change = std::find_if(Changes.begin(), Changes.end(),
                                     [&](const CHANGE& It) { return It.strKey == strKey; });
    if (Change != Changes.end()) {
      // A repeat of a key that was set goes the way of one that is taken out.
      strLine = Change->blFound ? "" : Change->strNewLine;
      Change->blFound = true;
    }
    if (!strLine.empty()) {
      fwrite(strLine.data(), 1, strLine.size(), pNew);
      blLineOpen = strLine.back() != '\n';
    }
  }
  if (Reader.Failed()) {
    return -1;
  }
  for (const CHANGE& Change : Changes) {
    if (Change.blFound || Change.strNewLine.empty()) {
      continue;
    }
    if (blLineOpen) {
      fputc('\n', pNew);
      blLineOpen = false;
    }
    fwrite(Change.strNewLine.data(), 1, Change.strNewLine.size(), pNew);
  }
  return fflush(pNew) == 0 && ferror(pNew) == 0 ? 0 : -1;
}

// Gives the file behind pNew the owner, group and mode of the one behind pOld.
int CopyOwnerAndMode(FILE* pOld, FILE* pNew) {
  struct stat Stat;
  if (fstat(fileno(pOld), &Stat) != 0 || fchown(fileno(pNew), Stat.st_uid, Stat.st_gid) != 0) {
    return -1;
  }
  return fchmod(fileno(pNew), Stat.st_mode & 07777);
}

// Replaces the file strReal in the directory behind DirFd by its changed copy. The order makes it
// hold through a power cut: the content is on stable storage before it gets its name.
int ReplaceFile(const std::string& strReal, const std::string& strDir, int DirFd,
                const std::vector<CHANGE>& Changes) {
  const char* szFile = strReal.c_str();
  const File pOld = OpenRegular(szFile);
  if (pOld == nullptr) {
    return ReportFailure(szFile, "open");
  }
  TmpFile New(strDir);
  if (New.Stream() == nullptr) {
    return ReportFailure(szFile, "creation of a temporary file");
  }
  if (CopyChanged(pOld.get(), New.Stream(), Changes) != 0) {
    return ReportFailure(szFile, "copy");
  }
  if (CopyOwnerAndMode(pOld.get(), New.Stream()) != 0) {
    return ReportFailure(szFile, "copy of owner and mode");
  }
  if (fsync(fileno(New.Stream())) != 0) {
    return ReportFailure(szFile, "fsync");
  }
  if (New.RenameTo(strReal) != 0) {
    return ReportFailure(szFile, "rename");
  }
  if (fsync(DirFd) != 0) {
    return ReportFailure(szFile, "fsync of the directory");
  }
  return 0;
}

int ChangeFile(const char* szFile, const std::vector<CHANGE>& Changes) {
  // A link stays: the file it leads to is the one that is replaced.
  const std::unique_ptr<char, decltype(&free)> pReal(realpath(szFile, nullptr), free);
  if (pReal == nullptr) {
    return ReportFailure(szFile, "realpath");
  }
  const std::string strReal = pReal.get();
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
  const File pFile = OpenRegular(szFile);
  if (pFile == nullptr) {
    return HoldsNoKeys(errno) ? -1 : ReportFailure(szFile, "open");
  }
  std::string strValue;
  const int Found = FindKey(pFile.get(), szKey, &strValue);
  if (Found <= 0) {
    return Found == 0 ? 0 : ReportFailure(szFile, "read");
  }
  strValue.copy(szValue, Size - 1);
  szValue[std::min(strValue.size(), Size - 1)] = '\0';
  return static_cast<int>(std::min<size_t>(strValue.size(), INT_MAX));
}

int ZAMOCFileChangeKeys(const char* szFile, const ZAMOCKeyChange* pChanges, size_t Count) {
  if (szFile == nullptr || pChanges == nullptr) {
    return -1;
  }
  std::vector<CHANGE> Changes;
  for (const ZAMOCKeyChange* pChange = pChanges; pChange != pChanges + Count; ++pChange) {
    CHANGE Change;
    Change.strKey = pChange->szKey == nullptr ? "" : pChange->szKey;
    if (pChange->szValue != nullptr && pChange->szFormat != nullptr) {
      Change.strNewLine = FormatLine(pChange->szFormat, Change.strKey, pChange->szValue);
    }
    if (Change.strKey.empty() || Change.strNewLine.empty() != (pChange->szValue == nullptr)) {
      errno = EINVAL;
      return ReportFailure(szFile, "change of a key");
    }
    Changes.push_back(Change);
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
  std::string strValue;
  const File pFile = OpenRegular(szFile);
  const int Found = pFile == nullptr ? -1 : FindKey(pFile.get(), szKey, &strValue);
  if (Found <= 0) {
    return Found == 0 ? 0 : ReportFailure(szFile, "read");
  }
  const ZAMOCKeyChange Change = {szKey, nullptr, nullptr};
  return ZAMOCFileChangeKeys(szFile, &Change, 1) == 0 ? 1 : -1;
}

void ZAMOCCopyright() { puts(TESSEL_NAME " " TESSEL_VERSION); }

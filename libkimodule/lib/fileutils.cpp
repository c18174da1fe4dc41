#include "fileutils.h"

#include <fcntl.h>
#include <pthread.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <string_view>
#include <utility>

#include "fileops.h"
#include "kidebuglog.h"
#include "kiflock.h"

namespace {

using KeySet = std::set<std::string>;
using KeyValMap = std::map<std::string, std::string>;

struct FileCloser {
  void operator()(FILE* pFile) const {
    const fileops::NoCancel Guard;
    fclose(pFile);
  }
};
using File = std::unique_ptr<FILE, FileCloser>;

struct LineBuffer {
  ~LineBuffer() { free(szLine); }
  char* szLine = nullptr;
  size_t Size = 0;
};

// Splits a line, without its line feed, into key and value. Returns 0, or -1 with both outputs
// unchanged if the line has no '='.
int ParseKeyVal(std::string_view Line, std::string_view& Key, std::string_view& Val) {
  const size_t Equal = Line.find('=');
  if (Equal == std::string_view::npos) {
    return -1;
  }
  Key = Line.substr(0, Equal);
  Val = Line.substr(Equal + 1);
  const size_t Open = Val.find('"');
  if (Open != std::string_view::npos && Open < Val.rfind('"')) {
    Val = Val.substr(Open + 1, Val.rfind('"') - Open - 1);
  }
  return 0;
}

struct ReadResult {
  int Match;  // the number of lines with a pair that counts; -1 if the file cannot be opened
  int Errno;  // of the failed open or read; 0 if the whole file was read
};

// Adds the pairs of szFile to KeyVals, except for keys that it has already. If pKeys is not null,
// only its keys count.
ReadResult ReadKeyVals(const char* szFile, const KeySet* pKeys, KeyValMap& KeyVals) {
  char rgBuf[4096];  // must outlive the stream; saves it asking the system for a size
  const File pFile(fopen(szFile, "re"));
  if (pFile == nullptr) {
    return {-1, errno};
  }
  setvbuf(pFile.get(), rgBuf, _IOFBF, sizeof(rgBuf));
  int Match = 0;
  LineBuffer Buffer;
  std::string_view Key;
  std::string_view Val;
  std::string strKey;
  for (;;) {
    const ssize_t Len = getline(&Buffer.szLine, &Buffer.Size, pFile.get());
    if (Len <= 0) {
      break;
    }
    std::string_view Line(Buffer.szLine, static_cast<size_t>(Len));
    if (Line.back() == '\n') {
      Line.remove_suffix(1);
    } else if (feof(pFile.get()) == 0) {
      break;  // the read failed within this line
    }
    if (ParseKeyVal(Line, Key, Val) != 0) {
      continue;
    }
    strKey = Key;
    if (pKeys == nullptr || pKeys->count(strKey) != 0) {
      KeyVals.try_emplace(KeyVals.end(), strKey, Val);  // the end is right if keys ascend
      ++Match;
    }
  }
  const int Errno = errno;
  return {Match, feof(pFile.get()) != 0 ? 0 : Errno};
}

// Waits for the lock without a time limit. A signal handler without SA_RESTART ends the wait of
// KiFlock.
int LockAfterSignals(KiFlock& Lock, bool blExclusive) {
  int Ret = -1;
  do {
    Ret = blExclusive ? Lock.LockEx(-1) : Lock.LockSh(-1);
  } while (Ret != 0 && errno == EINTR);
  return Ret;
}

// Adds the pairs of szFile to KeyVals under a shared lock. Returns the number of lines, or -1.
int GetKeyVals(const char* szFile, const KeySet* pKeys, KeyValMap& KeyVals) {
  // On ARM, a cancelled read is not unwound through the streams of the C library: the lock and the
  // stream would stay open.
  const fileops::NoCancel Guard;
  KiFlock Lock(szFile);
  if (LockAfterSignals(Lock, false) != 0) {
    KIDBGLOG(LOG_CATEG_UTILS, LOG_LEVEL_ERROR, "Failed to lock file [%s] with errno [%d]\n", szFile,
             errno);
    return -1;
  }
  const ReadResult Result = ReadKeyVals(szFile, pKeys, KeyVals);
  if (Result.Match == -1) {
    KIDBGLOG(LOG_CATEG_UTILS, LOG_LEVEL_ERROR, "Failed to open file [%s] with errno [%d]\n", szFile,
             Result.Errno);
  }
  return Result.Match;
}

// A thread that does nothing but read can be cancelled all the same: here, with nothing open.
int GetAndTestCancel(const char* szFile, const KeySet* pKeys, KeyValMap& KeyVals) {
  const int Match = GetKeyVals(szFile, pKeys, KeyVals);
  pthread_testcancel();
  return Match;
}

// Cancelling a thread in the middle of a change would leave a temporary file and a lock. Always
// enables cancellation at the end, unlike fileops::NoCancel.
class DisableThenEnableCancel {
 public:
  DisableThenEnableCancel() { pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, nullptr); }
  ~DisableThenEnableCancel() { pthread_setcancelstate(PTHREAD_CANCEL_ENABLE, nullptr); }
  DisableThenEnableCancel(const DisableThenEnableCancel&) = delete;
  DisableThenEnableCancel& operator=(const DisableThenEnableCancel&) = delete;
};

// Creates "szTemplate.tmp.XXXXXX" (mode 0600) with a unique name. Returns its descriptor, which the
// caller owns, and its name in strName; or -1 and an empty name after logging the reason.
int CreateTmpFile(const char* szTemplate, std::string& strName) {
  strName.assign(szTemplate).append(".tmp.XXXXXX");
  const fileops::NoCancel Guard;
  const int Fd = mkostemp(strName.data(), O_CLOEXEC);
  if (Fd == -1) {
    KIDBGLOG(LOG_CATEG_UTILS, LOG_LEVEL_ERROR, "Failed to create tmp file with errno [%d]\n",
             errno);
    strName.clear();
  }
  return Fd;
}

// Writes the pairs to Fd, which is open at the empty file szFile.
int WriteToFile(int Fd, const char* szFile, const KeyValMap& KeyVals, bool blQuoteVal) {
  if (*szFile == '\0') {
    KIDBGLOG(LOG_CATEG_UTILS, LOG_LEVEL_ERROR, "File not specified.\n");
    return -1;
  }
  const char* const szQuote = blQuoteVal ? "\"" : "";
  std::string strText;
  for (const auto& [strKey, strVal] : KeyVals) {
    strText.append(strKey).append("=").append(szQuote).append(strVal).append(szQuote).append("\n");
  }
  if (fileops::WriteAll(Fd, strText.data(), strText.size()) != 0) {
    // keep "wrtie": others search for this text
    KIDBGLOG(LOG_CATEG_UTILS, LOG_LEVEL_ERROR, "Failed to wrtie file [%s] with errno [%d].\n",
             szFile, errno);
    return -1;
  }
  return 0;
}

// Uses the temporary file by the descriptor that created it: whoever may write the directory can
// put a link to another file in its place, which an open or a chown by name would follow.
int WriteToFileAtomic(const char* szFile, const KeyValMap& KeyVals, bool blQuoteVal) {
  std::string strTmp;
  fileops::Descriptor Fd(CreateTmpFile(szFile, strTmp));
  fileops::TmpFile Tmp(std::move(strTmp));
  if (WriteToFile(Fd.Get(), Tmp.Name(), KeyVals, blQuoteVal) != 0) {
    return -1;
  }
  struct stat Stat;
  if (stat(szFile, &Stat) != 0) {
    KIDBGLOG(LOG_CATEG_UTILS, LOG_LEVEL_ERROR, "Failed to stat file [%s] with errno [%d]\n", szFile,
             errno);
    return -1;
  }
  if (fchown(Fd.Get(), Stat.st_uid, Stat.st_gid) != 0) {
    KIDBGLOG(LOG_CATEG_UTILS, LOG_LEVEL_ERROR, "Failed to chown [%s] with errno [%d]\n", Tmp.Name(),
             errno);
    return -1;
  }
  if (fchmod(Fd.Get(), Stat.st_mode & 07777) != 0) {
    KIDBGLOG(LOG_CATEG_UTILS, LOG_LEVEL_ERROR, "Failed to chmod [%s] with errno [%d]\n", Tmp.Name(),
             errno);
    return -1;
  }
  if (Fd.Close() != 0) {
    // Some file systems report only now that they could not store what was written.
    KIDBGLOG(LOG_CATEG_UTILS, LOG_LEVEL_ERROR, "Failed to wrtie file [%s] with errno [%d].\n",
             Tmp.Name(), errno);
    return -1;
  }
  if (Tmp.RenameTo(szFile) != 0) {
    KIDBGLOG(LOG_CATEG_UTILS, LOG_LEVEL_ERROR,
             "Failed to rename file [%s] to [%s] with errno [%d]\n", Tmp.Name(), szFile, errno);
    return -1;
  }
  return 0;
}

// Locks again if the previous holder of the lock has replaced the file.
int LockCurrent(KiFlock& Lock) {
  while (LockAfterSignals(Lock, true) == 0) {
    if (Lock.IsCurrent()) {
      return 0;
    }
    Lock.UnLock();
  }
  return -1;
}

int UpdateKeyVals(const char* szFile, const KeyValMap& AddKeyVals, const KeySet& DelKeys,
                  bool blQuoteVal) {
  if (AddKeyVals.empty() && DelKeys.empty()) {
    return 0;
  }
  const DisableThenEnableCancel Cancel;
  KiFlock Lock(szFile);
  if (LockCurrent(Lock) != 0) {
    KIDBGLOG(LOG_CATEG_UTILS, LOG_LEVEL_ERROR, "Failed to lock file [%s] with errno [%d]\n", szFile,
             errno);
    return -1;
  }
  KeyValMap KeyVals;
  const ReadResult Result = ReadKeyVals(szFile, nullptr, KeyVals);
  if (Result.Errno != 0) {
    // A failed read ends here too: what was read so far must not become the whole file.
    KIDBGLOG(LOG_CATEG_UTILS, LOG_LEVEL_ERROR, "Failed to open file [%s] with errno [%d]\n", szFile,
             Result.Errno);
    return -1;
  }
  for (const auto& [strKey, strVal] : AddKeyVals) {
    KeyVals[strKey] = strVal;
  }
  for (const std::string& strKey : DelKeys) {
    KeyVals.erase(strKey);
  }
  return WriteToFileAtomic(szFile, KeyVals, blQuoteVal);
}

}  // namespace

int KiFileGetAllKeyVals(const char* szFile, std::map<std::string, std::string>& KeyVals) {
  KeyVals.clear();
  return GetAndTestCancel(szFile, nullptr, KeyVals);
}

int KiFileGetKeyVals(const char* szFile, const std::set<std::string>& Keys,
                     std::map<std::string, std::string>& KeyVals) {
  KeyVals.clear();
  return GetAndTestCancel(szFile, &Keys, KeyVals);
}

int KiFileGetVal(const char* szFile, const char* szKey, std::string& strVal) {
  const std::string strKey = szKey;
  const KeySet Keys = {strKey};
  KeyValMap KeyVals;
  const int Ret = GetAndTestCancel(szFile, &Keys, KeyVals);
  strVal = KeyVals[strKey];
  return Ret;
}

int KiFileSetVal(const char* szFile, const char* szKey, const char* szVal, bool blQuoteVal) {
  return UpdateKeyVals(szFile, {{szKey, szVal}}, {}, blQuoteVal);
}

int KiFileSetVals(const char* szFile, const std::map<std::string, std::string>& NewKeyVals,
                  bool blQuoteVal) {
  return UpdateKeyVals(szFile, NewKeyVals, {}, blQuoteVal);
}

int KiFileRemoveKey(const char* szFile, const char* szKey) {
  return UpdateKeyVals(szFile, {}, {szKey}, false);
}

int KiFileRemoveKeys(const char* szFile, const std::set<std::string>& Keys) {
  return UpdateKeyVals(szFile, {}, Keys, false);
}

std::string CreateTmpFile(const char* szTemplate) {
  std::string strName;
  const fileops::Descriptor Fd(CreateTmpFile(szTemplate, strName));
  return strName;
}

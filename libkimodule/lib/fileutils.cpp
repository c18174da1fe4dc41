#include "fileutils.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <memory>

#include "kidebuglog.h"
#include "kiflock.h"

namespace {

using KEY_SET = std::set<std::string>;
using KEY_VAL_MAP = std::map<std::string, std::string>;

struct FileCloser {
  void operator()(FILE* pFile) const { fclose(pFile); }
};
using File = std::unique_ptr<FILE, FileCloser>;

struct LineBuffer {
  ~LineBuffer() { free(szLine); }
  char* szLine = nullptr;
  size_t Size = 0;
};

// Takes a line, without its line feed, apart. Returns -1 with both outputs as they were when it
// carries no pair.
int ParseKeyVal(const std::string& strLine, std::string& strKey, std::string& strVal) {
  const size_t Equal = strLine.find('=');
  if (Equal == std::string::npos) {
    return -1;
  }
  strKey = strLine.substr(0, Equal);
  const size_t Open = strLine.find('"', Equal + 1);
  const size_t Close = strLine.rfind('"');
  if (Open != std::string::npos && Open < Close) {
    strVal = strLine.substr(Open + 1, Close - Open - 1);
  } else {
    strVal = strLine.substr(Equal + 1);
  }
  return 0;
}

// Puts the pairs of the lines that are left into KeyVals, unless their keys are there already, and
// adds the number of those lines to Match; with a pKeys, only its keys count. Returns 0, or the
// errno of a read that failed.
int ReadKeyVals(FILE* pFile, const KEY_SET* pKeys, KEY_VAL_MAP& KeyVals, int& Match) {
  LineBuffer Buffer;
  std::string strKey;
  std::string strVal;
  for (ssize_t Len; (Len = getline(&Buffer.szLine, &Buffer.Size, pFile)) > 0;) {
    std::string strLine(Buffer.szLine, static_cast<size_t>(Len));
    if (strLine.back() == '\n') {
      strLine.pop_back();
    } else if (feof(pFile) == 0) {
      break;  // the part of a line before a failed read
    }
    if (ParseKeyVal(strLine, strKey, strVal) != 0 ||
        (pKeys != nullptr && pKeys->count(strKey) == 0)) {
      continue;
    }
    KeyVals.emplace(strKey, strVal);
    ++Match;
  }
  const int Errno = errno;
  return feof(pFile) != 0 ? 0 : Errno;
}

// Adds to KeyVals what it does not hold yet.
int GetKeyVals(const char* szFile, const KEY_SET* pKeys, KEY_VAL_MAP& KeyVals) {
  KiFlock Lock(szFile);
  if (Lock.LockSh(-1) != 0) {
    KIDBGLOG(LOG_CATEG_UTILS, LOG_LEVEL_ERROR, "Failed to lock file [%s] with errno [%d]\n", szFile,
             errno);
    return -1;
  }
  const File pFile(fopen(szFile, "re"));
  if (pFile == nullptr) {
    KIDBGLOG(LOG_CATEG_UTILS, LOG_LEVEL_ERROR, "Failed to open file [%s] with errno [%d]\n", szFile,
             errno);
    return -1;
  }
  int Match = 0;
  ReadKeyVals(pFile.get(), pKeys, KeyVals, Match);
  return Match;
}

}  // namespace

int KiFileGetAllKeyVals(const char* szFile, std::map<std::string, std::string>& KeyVals) {
  KeyVals.clear();
  return GetKeyVals(szFile, nullptr, KeyVals);
}

int KiFileGetKeyVals(const char* szFile, const std::set<std::string>& Keys,
                     std::map<std::string, std::string>& KeyVals) {
  KeyVals.clear();
  return GetKeyVals(szFile, &Keys, KeyVals);
}

int KiFileGetVal(const char* szFile, const char* szKey, std::string& strVal) {
  const std::string strKey = szKey;
  const KEY_SET Keys = {strKey};
  KEY_VAL_MAP KeyVals;
  const int Ret = GetKeyVals(szFile, &Keys, KeyVals);
  strVal = KeyVals[strKey];
  return Ret;
}

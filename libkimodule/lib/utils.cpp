#include "utils.h"

#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string_view>

#include "basename.h"
#include "delaytimer.h"
#include "kidebuglog.h"
#include "strtoint32.h"

namespace {

constexpr int32_t WRITE_RETRY_USEC = 10000;
constexpr int MAX_EMPTY_WRITES = 5;

// The value of a hexadecimal digit, or -1.
int HexDigit(char Character) {
  if (Character >= '0' && Character <= '9') {
    return Character - '0';
  }
  if (Character >= 'a' && Character <= 'f') {
    return Character - 'a' + 10;
  }
  if (Character >= 'A' && Character <= 'F') {
    return Character - 'A' + 10;
  }
  return -1;
}

char toHex(unsigned Nibble) {
  return static_cast<char>(Nibble > 9 ? 'A' + Nibble - 10 : '0' + Nibble);
}

}  // namespace

std::string GetBaseName(const std::string& strFullPath) {
  return strFullPath.substr(BaseNameOffset(strFullPath));
}

std::string itos(int64_t i) { return std::to_string(i); }

int32_t Hex2Dec(const char* pHex, int32_t Len) {
  uint32_t Value = 0;  // unsigned: may overflow, then the last eight digits count
  for (int32_t Idx = 0; Idx < Len; ++Idx) {
    const int Digit = HexDigit(pHex[Idx]);
    if (Digit == -1) {
      break;
    }
    Value = Value * 16 + static_cast<uint32_t>(Digit);
  }
  return static_cast<int32_t>(Value);
}

std::string urlEncoding(const std::string& strInput, const std::string& strExtraUrlUnencodedChars) {
  enum KIND : unsigned char { ENCODED, UNENCODED, WHITE };
  std::array<KIND, 256> Kinds = {};
  const auto Set = [&Kinds](std::string_view Characters, KIND Kind) {
    for (const char Character : Characters) {
      Kinds[static_cast<unsigned char>(Character)] = Kind;
    }
  };
  Set("ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789_~()*,-.", UNENCODED);
  Set(strExtraUrlUnencodedChars, UNENCODED);
  Set(" \t\n\v\f\r", WHITE);  // last: also white space among the extra characters becomes %20

  std::string strOutput;
  strOutput.reserve(strInput.size());
  for (const char Character : strInput) {
    const auto Byte = static_cast<unsigned char>(Character);
    if (Kinds[Byte] == UNENCODED) {
      strOutput += Character;
    } else if (Kinds[Byte] == WHITE) {
      strOutput += "%20";
    } else {
      strOutput += {'%', toHex(Byte >> 4), toHex(Byte & 15)};
    }
  }
  return strOutput;
}

void StringEraseCharacter(std::string& strInput, char Character) {
  strInput.erase(std::remove(strInput.begin(), strInput.end(), Character), strInput.end());
}

std::string Trim(const std::string& strOrig, const char* szChars) {
  if (szChars == nullptr) {
    return strOrig;
  }
  const size_t First = strOrig.find_first_not_of(szChars);
  if (First == std::string::npos) {
    return "";
  }
  return strOrig.substr(First, strOrig.find_last_not_of(szChars) - First + 1);
}

char* Strncpy(char* szDst, const char* szSrc, size_t BufLen) {
  if (BufLen > 0) {
    strncpy(szDst, szSrc, BufLen - 1);  // zeroes the rest
    szDst[BufLen - 1] = '\0';
  }
  return szDst;
}

void ReplaceSubstr(std::string& strInput, const std::string& strSub,
                   const std::string& strReplace) {
  if (strSub.empty()) {
    return;
  }
  std::string strOutput;
  size_t Done = 0;
  size_t Pos = strInput.find(strSub);
  while (Pos != std::string::npos) {
    strOutput.append(strInput, Done, Pos - Done).append(strReplace);
    Done = Pos + strSub.size();
    Pos = strInput.find(strSub, Done);
  }
  strOutput.append(strInput, Done, std::string::npos);
  strInput = std::move(strOutput);
}

char* HttpBase64Encode(const char* src) {
  static const char szAlphabet[] =
      "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  const size_t Len = strlen(src);
  // malloc and not new: the caller uses free().
  char* const szText = static_cast<char*>(malloc((Len + 2) / 3 * 4 + 1));
  if (szText == nullptr) {
    return nullptr;
  }
  const auto* const pIn = reinterpret_cast<const unsigned char*>(src);
  char* pOut = szText;
  for (size_t Done = 0; Done < Len; Done += 3) {
    const unsigned First = pIn[Done];
    const unsigned Second = pIn[Done + 1];  // the terminating 0 at the end of the text
    const unsigned Third = Done + 1 < Len ? pIn[Done + 2] : 0;
    *pOut++ = szAlphabet[First >> 2];
    *pOut++ = szAlphabet[(First & 3) << 4 | Second >> 4];
    *pOut++ = Done + 1 < Len ? szAlphabet[(Second & 15) << 2 | Third >> 6] : '=';
    *pOut++ = Done + 2 < Len ? szAlphabet[Third & 63] : '=';
  }
  *pOut = '\0';
  return szText;
}

std::string UnsignedHashToStr(const unsigned char* pHashBuf) {
  static const char szDigits[] = "0123456789abcdef";
  std::string strText;
  for (int Idx = 0; Idx < 16; ++Idx) {
    strText += {szDigits[pHashBuf[Idx] >> 4], szDigits[pHashBuf[Idx] & 15]};
  }
  return strText;
}

std::vector<int32_t> String2IntVector(const std::string& strValue, const std::string& strDelim) {
  std::vector<int32_t> Numbers;
  if (strValue.empty() || strDelim.empty()) {
    return Numbers;
  }
  // strtok_r writes into the text that it splits.
  const std::unique_ptr<char, decltype(&free)> pCopy(strdup(strValue.c_str()), free);
  if (pCopy == nullptr) {
    return Numbers;
  }
  char* pRest = nullptr;
  for (const char* szPiece = strtok_r(pCopy.get(), strDelim.c_str(), &pRest); szPiece != nullptr;
       szPiece = strtok_r(nullptr, strDelim.c_str(), &pRest)) {
    Numbers.push_back(StrToInt32(szPiece));
  }
  return Numbers;
}

double GetAbsTimeDiffBySec(time_t EndTime, time_t StartTime) {
  return std::fabs(difftime(EndTime, StartTime));
}

int64_t GetAbsTimeDiffUSec(const timeval& tvOld, const timeval& tvNew) {
  const int64_t Diff = GetTimeDiffUSec(tvOld, tvNew);
  // unsigned: the lowest number has no positive counterpart
  return Diff < 0 ? static_cast<int64_t>(-static_cast<uint64_t>(Diff)) : Diff;
}

int64_t GetCurTimestamp() {
  timeval tvNow;
  gettimeofday(&tvNow, nullptr);
  return GetTimeDiffUSec({0, 0}, tvNow);
}

std::string GetISO8601TimeText(int64_t TimeStamp) {
  const time_t Sec = USecToSec(TimeStamp);
  const auto MSec = static_cast<long long>(TimeStamp / 1000 % 1000);
  tm Utc = {};
  gmtime_r(&Sec, &Utc);
  char szTime[64] = "";
  char szMSec[64] = "";
  strftime(szTime, sizeof(szTime), "%Y%m%dT%H%M%S", &Utc);
  snprintf(szMSec, sizeof(szMSec), ".%03lldZ", MSec);
  return std::string(szTime) + szMSec;
}

int32_t WriteFd(int Fd, const void* pBuf, int32_t BufLen) {
  const char* const pBytes = static_cast<const char*>(pBuf);
  DelayTimer Timer(WRITE_RETRY_USEC);
  int32_t Written = 0;
  int EmptyWrites = 0;
  while (Written < BufLen) {
    const ssize_t Len = write(Fd, pBytes + Written, static_cast<size_t>(BufLen - Written));
    if (Len > 0) {
      Written += static_cast<int32_t>(Len);
    } else if (Len == 0) {
      // Without progress and without an error, the loop might never end.
      if (++EmptyWrites > MAX_EMPTY_WRITES) {
        break;
      }
    } else if (errno == EAGAIN || errno == EINTR) {
      Timer.Delay();
    } else {
      KIDBGLOG(LOG_CATEG_UTILS, LOG_LEVEL_NOTICE, "Write fd[%d] error[%d]\n", Fd, errno);
      break;
    }
  }
  return Written;
}

// Programs that were linked to version 1.0.0 call this form. No header declares it.
int32_t WriteFd(int Fd, const char* pBuf, int32_t BufLen) {
  return WriteFd(Fd, static_cast<const void*>(pBuf), BufLen);
}

bool CreateThread(ThreadFunc FuncPtr, void* FuncParam, uint32_t StackSize, bool blSetDetach,
                  pthread_t& ThreadId) {
  pthread_attr_t Attr;
  pthread_attr_init(&Attr);
  if (StackSize != 0) {  // a size that the system refuses leaves the default
    pthread_attr_setstacksize(&Attr, StackSize);
  }
  if (blSetDetach) {
    pthread_attr_setdetachstate(&Attr, PTHREAD_CREATE_DETACHED);
  }
  const bool blStarted = pthread_create(&ThreadId, &Attr, FuncPtr, FuncParam) == 0;
  if (!blStarted) {
    KIDBGLOG(LOG_CATEG_UTILS, LOG_LEVEL_ERROR, "Failed to create thread.\n");
  }
  pthread_attr_destroy(&Attr);
  return blStarted;
}

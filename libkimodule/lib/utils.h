// Small, stateless helpers that the package's processes share. Any thread may call any of them.
#pragma once

#include <pthread.h>
#include <sys/ipc.h>
#include <sys/shm.h>
#include <sys/time.h>

#include <cstddef>
#include <cstdint>
#include <ctime>
#include <string>
#include <vector>

// On 32-bit systems compiler flags decide the size of time_t and timeval. The library and its users
// must have the same.
static_assert(sizeof(time_t) == 8 && sizeof(timeval) == 16,
              "compile with -D_FILE_OFFSET_BITS=64 -D_TIME_BITS=64, as the library is");

// The part of strFullPath after its last '/' or '\', or all of it if it has neither.
std::string GetBaseName(const std::string& strFullPath);

// The decimal text of i.
std::string itos(int64_t i);

// The value of the hexadecimal digits (upper or lower case) at pHex. Reads at most Len bytes and
// stops at the first byte that is no digit. Returns 0 if there is no digit. If there are more than
// eight digits, the last eight count.
int32_t Hex2Dec(const char* pHex, int32_t Len);

// Percent-encodes strInput for a URL. Keeps ASCII letters, digits, _~()*,-. and the bytes in
// strExtraUrlUnencodedChars. White space of any kind becomes %20.
std::string urlEncoding(const std::string& strInput, const std::string& strExtraUrlUnencodedChars);

// Removes every Character from strInput.
void StringEraseCharacter(std::string& strInput, char Character);

// strOrig without the bytes of szChars at both ends. If szChars is null, nothing is removed.
std::string Trim(const std::string& strOrig, const char* szChars);

// Copies szSrc to szDst, a buffer of BufLen bytes, and truncates what does not fit. Terminates the
// copy and zeroes the rest of the buffer. Does nothing if BufLen is 0. Returns szDst.
char* Strncpy(char* szDst, const char* szSrc, size_t BufLen);

// Replaces every strSub in strInput, from left to right. Does not search the replacements. Does
// nothing if strSub is empty.
void ReplaceSubstr(std::string& strInput, const std::string& strSub, const std::string& strReplace);

// The base64 text (RFC 4648, without line breaks) of src, up to its NUL. The caller releases it
// with free(). Returns null if memory runs out.
char* HttpBase64Encode(const char* src);

// The 32 lower-case hexadecimal digits of a 16-byte hash.
std::string UnsignedHashToStr(const unsigned char* pHashBuf);

// Splits strValue, up to its first NUL, at every byte that is in strDelim, and returns the numbers
// of the non-empty pieces. The number of a piece is the decimal number at its start, or 0 if there
// is none. A number outside the 32-bit range gives the nearest limit of that range.
std::vector<int32_t> String2IntVector(const std::string& strValue, const std::string& strDelim);

// A point in time is a timeval, a count of microseconds since 1970-01-01 00:00:00 UTC
// ("timestamp"), or a time_t. The current time comes from the wall clock, which can be set back.

// The seconds between two points in time, never negative.
double GetAbsTimeDiffBySec(time_t EndTime, time_t StartTime);

// The microseconds from tvOld to tvNew; negative if tvNew is earlier.
inline int64_t GetTimeDiffUSec(const timeval& tvOld, const timeval& tvNew) {
  const auto Sec = static_cast<uint64_t>(tvNew.tv_sec) - static_cast<uint64_t>(tvOld.tv_sec);
  const auto USec = static_cast<uint64_t>(tvNew.tv_usec) - static_cast<uint64_t>(tvOld.tv_usec);
  return static_cast<int64_t>(Sec * 1000000 + USec);  // unsigned: defined for every input
}

int64_t GetAbsTimeDiffUSec(const timeval& tvOld, const timeval& tvNew);

// The current time as a timestamp.
int64_t GetCurTimestamp();

// Converts microseconds to seconds, rounded towards zero.
inline time_t USecToSec(int64_t USec) { return static_cast<time_t>(USec / 1000000); }

// A timestamp as text in UTC, like "20231114T221320.123Z". Fractions of a millisecond are cut off.
// Before 1970 the milliseconds are negative.
std::string GetISO8601TimeText(int64_t TimeStamp);

// Writes the BufLen bytes at pBuf to Fd, in as many calls as needed and without a time limit. Tries
// again every 10 ms while the descriptor is not ready. Returns the number of bytes written. It is
// less than BufLen after an error, which is logged (LOG_CATEG_UTILS, LOG_LEVEL_NOTICE), or after
// six writes of no bytes.
int32_t WriteFd(int Fd, const void* pBuf, int32_t BufLen);

typedef void* (*ThreadFunc)(void* pParam);

// Starts a thread that runs FuncPtr(FuncParam). Its stack has StackSize bytes, or the default size
// if StackSize is 0 or a size that the system refuses. If blSetDetach is true, the thread is
// detached; else the caller must join it. Returns true with the thread's identifier in ThreadId, or
// false after logging the failure (LOG_CATEG_UTILS, LOG_LEVEL_ERROR). What FuncParam points to must
// live as long as the thread needs it.
bool CreateThread(ThreadFunc FuncPtr, void* FuncParam, uint32_t StackSize, bool blSetDetach,
                  pthread_t& ThreadId);

// Attaches the System V shared memory segment of that key for reading and writing, and returns it
// as a T. Returns null if there is no such segment or attaching it fails. Does not compare the
// segment's size with sizeof(T). The caller detaches it with ShmDt.
template <typename T>
T* ShmAt(key_t Key) {
  const int Id = shmget(Key, 0, 0);
  if (Id == -1) {
    return nullptr;
  }
  void* pShm = shmat(Id, nullptr, 0);
  return reinterpret_cast<intptr_t>(pShm) == -1 ? nullptr : static_cast<T*>(pShm);
}

// Detaches pCache and sets it to null. Does nothing if it is null.
template <typename T>
void ShmDt(T*& pCache) {
  if (pCache != nullptr) {
    const T* pShm = pCache;
    pCache = nullptr;  // first, so that no thread uses it after the detach
    shmdt(pShm);
  }
}

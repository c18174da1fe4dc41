// Small, stateless helpers shared by the package's processes. All may be called from any thread.
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

// On 32-bit systems flags decide the size of time_t and timeval, which must be that of the library.
static_assert(sizeof(time_t) == 8 && sizeof(timeval) == 16,
              "compile with -D_FILE_OFFSET_BITS=64 -D_TIME_BITS=64, as the library is");

// The part of strFullPath after its last '/' or '\', or all of it when it has neither.
std::string GetBaseName(const std::string& strFullPath);

// The decimal text of i.
std::string itos(int64_t i);

// The value of the hexadecimal digits, of either case, among the Len bytes at pHex, up to the first
// byte that is none; 0 without any. Of more than eight digits the last eight count.
int32_t Hex2Dec(const char* pHex, int32_t Len);

// strInput percent-encoded for a URL. ASCII letters, digits and _~()*,-. stay, and so do the bytes
// in strExtraUrlUnencodedChars; white space of any kind becomes %20.
std::string urlEncoding(const std::string& strInput, const std::string& strExtraUrlUnencodedChars);

// Takes every Character out of strInput.
void StringEraseCharacter(std::string& strInput, char Character);

// strOrig without the bytes in szChars at its two ends. Null stands for none.
std::string Trim(const std::string& strOrig, const char* szChars);

// Copies szSrc to szDst, a buffer of BufLen bytes, cutting what does not fit. The copy is always
// terminated, and the rest of the buffer zeroed; with a BufLen of 0 nothing is done. Returns szDst.
char* Strncpy(char* szDst, const char* szSrc, size_t BufLen);

// Replaces every strSub in strInput, from left to right; what was put in is not searched again. An
// empty strSub leaves strInput as it is.
void ReplaceSubstr(std::string& strInput, const std::string& strSub, const std::string& strReplace);

// The base64 text (RFC 4648, without line breaks) of src, up to its NUL. The caller releases it
// with free(). Null when there is no memory.
char* HttpBase64Encode(const char* src);

// The 32 lower-case hexadecimal digits of a 16-byte hash.
std::string UnsignedHashToStr(const unsigned char* pHashBuf);

// The numbers in strValue, up to its first NUL, parted by any of the bytes in strDelim, empty
// pieces left out. Each piece is read as far as it is a decimal number, else it is 0; one beyond
// the 32-bit range gives the range's nearest end.
std::vector<int32_t> String2IntVector(const std::string& strValue, const std::string& strDelim);

// A point in time is a timeval, a count of microseconds since 1970-01-01 00:00:00 UTC
// ("timestamp"), or a time_t. The current time is the wall clock's, which can be set back.

// The seconds between the two.
double GetAbsTimeDiffBySec(time_t EndTime, time_t StartTime);

// The microseconds from tvOld to tvNew, negative when tvNew is earlier.
inline int64_t GetTimeDiffUSec(const timeval& tvOld, const timeval& tvNew) {
  const auto Sec = static_cast<uint64_t>(tvNew.tv_sec) - static_cast<uint64_t>(tvOld.tv_sec);
  const auto USec = static_cast<uint64_t>(tvNew.tv_usec) - static_cast<uint64_t>(tvOld.tv_usec);
  return static_cast<int64_t>(Sec * 1000000 + USec);  // unsigned: defined for every input
}

int64_t GetAbsTimeDiffUSec(const timeval& tvOld, const timeval& tvNew);

// The timestamp of now.
int64_t GetCurTimestamp();

// Microseconds as seconds, cut off towards zero.
inline time_t USecToSec(int64_t USec) { return static_cast<time_t>(USec / 1000000); }

// A timestamp as UTC, like "20231114T221320.123Z". What is below the millisecond is cut off. Before
// 1970 the milliseconds are negative.
std::string GetISO8601TimeText(int64_t TimeStamp);

// Writes the BufLen bytes at pBuf to Fd, however many calls it takes, and for as long as it takes:
// a descriptor that is not ready is tried again every 10 ms. Returns the number of bytes written:
// fewer than BufLen after an error, which is logged (LOG_CATEG_UTILS, LOG_LEVEL_NOTICE), or when
// nothing was taken six times.
int32_t WriteFd(int Fd, const void* pBuf, int32_t BufLen);

typedef void* (*ThreadFunc)(void* pParam);

// Starts a thread that runs FuncPtr(FuncParam), with a stack of StackSize bytes (0, or a size that
// the system refuses: the default) and, if blSetDetach, detached; else the caller joins it. Returns
// whether it was started, with its identifier in ThreadId; a failure is logged (LOG_CATEG_UTILS,
// LOG_LEVEL_ERROR). What FuncParam points to has to live as long as the thread needs it.
bool CreateThread(ThreadFunc FuncPtr, void* FuncParam, uint32_t StackSize, bool blSetDetach,
                  pthread_t& ThreadId);

// Attaches the System V shared memory segment with the key, for reading and writing, viewed as a T.
// Null when there is none or attaching it is refused. Its size is not compared with T's. The caller
// detaches it with ShmDt.
template <typename T>
T* ShmAt(key_t Key) {
  const int Id = shmget(Key, 0, 0);
  if (Id == -1) {
    return nullptr;
  }
  void* pShm = shmat(Id, nullptr, 0);
  return reinterpret_cast<intptr_t>(pShm) == -1 ? nullptr : static_cast<T*>(pShm);
}

// Detaches pCache and sets it to null, unless it is null already.
template <typename T>
void ShmDt(T*& pCache) {
  if (pCache != nullptr) {
    const T* pShm = pCache;
    pCache = nullptr;  // first, so that nobody follows it to what is going
    shmdt(pShm);
  }
}

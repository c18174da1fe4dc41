// Small, stateless helpers shared by the package's processes. All may be called from any thread.
#pragma once

#include <sys/ipc.h>
#include <sys/shm.h>

#include <cstdint>
#include <string>

// The part of strFullPath after its last '/' or '\', or all of it when it has neither.
std::string GetBaseName(const std::string& strFullPath);

// The decimal text of i.
std::string itos(int64_t i);

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

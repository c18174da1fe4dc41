#include "fileops.h"

#include <fcntl.h>
#include <pthread.h>
#include <unistd.h>

#include <cstdio>
#include <utility>

namespace fileops {

NoCancel::NoCancel() : m_OldState(PTHREAD_CANCEL_ENABLE) {
  pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &m_OldState);
}

NoCancel::~NoCancel() { pthread_setcancelstate(m_OldState, nullptr); }

Descriptor::~Descriptor() {
  const ErrnoKeeper Errno;
  Close();
}

int Descriptor::Close() {
  if (m_Fd == -1) {
    return 0;
  }
  const NoCancel Guard;
  // Linux releases the descriptor even if close fails. To close it again might close another
  // thread's.
  return close(std::exchange(m_Fd, -1));
}

TmpFile::TmpFile(std::string strName) noexcept : m_strName(std::move(strName)) {}

TmpFile::~TmpFile() {
  const ErrnoKeeper Errno;
  if (!m_strName.empty()) {
    unlink(m_strName.c_str());
  }
}

int TmpFile::RenameTo(const char* szFile) {
  if (rename(m_strName.c_str(), szFile) != 0) {
    return -1;
  }
  m_strName.clear();
  return 0;
}

int CreateAnew(const char* szName) {
  // O_EXCL: a link in this place is never followed.
  const auto Create = [szName] {
    return open(szName, O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
  };
  const NoCancel Guard;
  const int Fd = Create();
  if (Fd == -1 && errno == EEXIST && unlink(szName) == 0) {
    return Create();  // once: somebody without the lock could go on creating the file
  }
  return Fd;
}

int WriteAll(int Fd, const void* pBuf, size_t Len) {
  const char* pNext = static_cast<const char*>(pBuf);
  while (Len > 0) {
    const ssize_t Written = write(Fd, pNext, Len);
    if (Written > 0) {
      pNext += Written;
      Len -= static_cast<size_t>(Written);
    } else if (Written == 0) {
      errno = EIO;  // without progress the loop would never end
      return -1;
    } else if (errno != EINTR) {
      return -1;
    }
  }
  return 0;
}

}  // namespace fileops

#include "kiflock.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <utility>

#include "fileops.h"
#include "sleep.h"

namespace {

constexpr int ATTEMPTS_PER_SEC = 10;
constexpr int64_t ATTEMPT_DELAY_USEC = 1000000 / ATTEMPTS_PER_SEC;

}  // namespace

KiFlock::KiFlock(std::string strName) : m_strName(std::move(strName)), m_Fd(-1) {}

KiFlock::~KiFlock() { UnLock(); }

int KiFlock::LockSh(int TimeoutSec) { return Flock(TimeoutSec, false); }

int KiFlock::LockEx(int TimeoutSec) { return Flock(TimeoutSec, true); }

bool KiFlock::IsCurrent() const {
  struct stat Open;
  struct stat Named;
  // A replaced file has the name, but another inode.
  return fstat(m_Fd, &Open) == 0 && stat(m_strName.c_str(), &Named) == 0 &&
         Open.st_dev == Named.st_dev && Open.st_ino == Named.st_ino;
}

void KiFlock::UnLock() {
  if (m_Fd < 0) {
    return;
  }
  const fileops::NoCancel Guard;  // the destructor calls this too
  UnLock(m_Fd);  // close alone keeps the lock while a forked child has the file open
  close(m_Fd);
  m_Fd = -1;
}

int KiFlock::Lock(int Fd, int TimeoutSec, bool blExclusive) {
  const int Operation = blExclusive ? LOCK_EX : LOCK_SH;
  if (TimeoutSec < 0) {
    return flock(Fd, Operation);
  }
  if (TimeoutSec == 0) {
    return flock(Fd, Operation | LOCK_NB);
  }
  // flock has no time limit of its own, and an alarm would be the whole process's.
  int Ret = -1;
  int Errno = 0;
  for (int64_t Left = int64_t{TimeoutSec} * ATTEMPTS_PER_SEC; Left > 0; --Left) {
    Ret = flock(Fd, Operation | LOCK_NB);
    if (Ret == 0) {
      return 0;
    }
    Errno = errno;
    SleepWhole(ATTEMPT_DELAY_USEC);
  }
  errno = Errno;
  return Ret;
}

int KiFlock::UnLock(int Fd) { return flock(Fd, LOCK_UN); }

int KiFlock::Flock(int TimeoutSec, bool blExclusive) {
  if (m_Fd == -1) {
    const fileops::NoCancel Guard;
    // flock needs no permission to write.
    m_Fd = open(m_strName.c_str(), O_RDONLY | O_CREAT | O_CLOEXEC, 0644);
    if (m_Fd == -1) {
      return -1;
    }
  }
  return Lock(m_Fd, TimeoutSec, blExclusive);
}

// Advisory locks (flock(2)). The package's processes use only these to exclude each other from a
// file.
#pragma once

#include <string>

// A lock on the file at a path. The first LockSh or LockEx opens the file, and creates it (mode
// 0644 less the umask) if it is missing. UnLock() and the destructor release the lock and close the
// file. Every object has its own descriptor and so excludes other threads as well as other
// processes. Threads must not share an object.
class KiFlock {
 public:
  // Does not open the file.
  explicit KiFlock(std::string strName);
  ~KiFlock();
  KiFlock(const KiFlock&) = delete;
  KiFlock& operator=(const KiFlock&) = delete;

  // Acquires a shared or exclusive lock, or converts the one held. TimeoutSec is as in Lock()
  // below. Returns 0, or -1 with errno if the file cannot be opened or the lock cannot be acquired.
  // After a timeout the file stays open but unlocked.
  int LockSh(int TimeoutSec);
  int LockEx(int TimeoutSec);

  // True if the path still leads to the file that this object has open. If others replace the file
  // under its lock, a lock acquired after waiting may be on a file that has been replaced.
  bool IsCurrent() const;

  // Releases the lock and closes the file, if it is open. Neither UnLock() nor the destructor is a
  // cancellation point.
  void UnLock();

  // Locks the open descriptor Fd. A TimeoutSec below 0 waits until the lock is free or a signal
  // handler without SA_RESTART runs (EINTR), 0 tries once, and a positive number tries ten times a
  // second for that many seconds, whatever signals arrive. Returns 0, or -1 with flock's errno.
  static int Lock(int Fd, int TimeoutSec, bool blExclusive);

  // Unlocks the descriptor Fd. Returns 0, or -1 with flock's errno.
  static int UnLock(int Fd);

 private:
  int Flock(int TimeoutSec, bool blExclusive);

  const std::string m_strName;
  int m_Fd;
};

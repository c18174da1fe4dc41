// Advisory flock(2) locks: the one way in which the package's processes exclude each other from a
// file.
#pragma once

#include <string>

// A lock on the file at a path. An object opens the file (creating it, mode 0644 less the umask,
// when it is missing) at its first LockSh or LockEx, owns that descriptor, and releases the lock
// and closes it in UnLock() or its destructor. Since every object has a descriptor of its own, it
// excludes other threads as well as other processes; one object is not shared between threads.
class KiFlock {
 public:
  // Opens nothing.
  explicit KiFlock(std::string strName);
  ~KiFlock();
  KiFlock(const KiFlock&) = delete;
  KiFlock& operator=(const KiFlock&) = delete;

  // Takes a shared or exclusive lock, or converts the one held. TimeoutSec is as in Lock() below.
  // Returns 0, or -1 with errno when the file cannot be opened or the lock is not obtained; after
  // a timeout the file stays open, unlocked.
  int LockSh(int TimeoutSec);
  int LockEx(int TimeoutSec);

  // Whether the path still leads to the file that this object has open. Where files are replaced
  // under their lock, one obtained after waiting may be that of a file already replaced.
  bool IsCurrent() const;

  // Does nothing on an object that holds no descriptor. Neither it nor the destructor is a
  // cancellation point.
  void UnLock();

  // Locks the open descriptor Fd. TimeoutSec below 0 waits for ever, 0 tries once, and a positive
  // number tries ten times a second for that many seconds. Returns 0, or -1 with flock's errno.
  static int Lock(int Fd, int TimeoutSec, bool blExclusive);

  // Returns flock's result: 0, or -1 with errno.
  static int UnLock(int Fd);

 private:
  int Flock(int TimeoutSec, bool blExclusive);

  const std::string m_strName;
  int m_Fd;
};

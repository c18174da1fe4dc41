// Operations on files that must not leak, lose errno or end the process, for the library itself and
// the programs built with it; not installed.
#pragma once

#include <cerrno>
#include <cstddef>
#include <string>

namespace fileops {

// Keeps errno: it has the same value after the object as before it.
class ErrnoKeeper {
 public:
  ErrnoKeeper() = default;
  ~ErrnoKeeper() { errno = m_Errno; }
  ErrnoKeeper(const ErrnoKeeper&) = delete;
  ErrnoKeeper& operator=(const ErrnoKeeper&) = delete;

  int Get() const { return m_Errno; }

 private:
  const int m_Errno = errno;
};

// Disables cancellation of the calling thread during its lifetime, and restores the state that it
// found. Every destructor that calls a cancellation point (close, fclose, ...) needs one, because
// cancellation throws there and so ends the whole process. A request that arrives meanwhile waits
// for the thread's next cancellation point.
class NoCancel {
 public:
  NoCancel();
  ~NoCancel();
  NoCancel(const NoCancel&) = delete;
  NoCancel& operator=(const NoCancel&) = delete;

 private:
  int m_OldState;
};

// Owns a descriptor, or none (-1).
class Descriptor {
 public:
  explicit Descriptor(int Fd) : m_Fd(Fd) {}

  // Closes the descriptor with cancellation disabled, and keeps errno.
  ~Descriptor();
  Descriptor(const Descriptor&) = delete;
  Descriptor& operator=(const Descriptor&) = delete;

  int Get() const { return m_Fd; }

  // Closes the descriptor with cancellation disabled. Returns 0, at once when there is none, or -1
  // with errno. The object owns none afterwards.
  int Close();

 private:
  int m_Fd;
};

// Owns the file of a temporary name: removes it, and keeps errno, unless RenameTo has given it its
// final name. The owner of its descriptor is another.
class TmpFile {
 public:
  // Adopts the file strName, which the caller has created. An empty name stands for no file.
  explicit TmpFile(std::string strName);
  ~TmpFile();
  TmpFile(const TmpFile&) = delete;
  TmpFile& operator=(const TmpFile&) = delete;

  // Empty when there is no file, or no more.
  const char* Name() const { return m_strName.c_str(); }

  // Moves the file to szFile, in place of the one that is there. Returns 0, or -1 with errno: the
  // object then still owns the file.
  int RenameTo(const char* szFile);

 private:
  std::string m_strName;
};

// Creates the file szName (mode 0600) and opens it for writing. Removes first what has the name
// already: the caller holds a lock that lets nobody else create it, so a killed process left it
// behind. Returns the descriptor, which the caller owns, or -1 with errno.
int CreateAnew(const char* szName);

// Writes all Len bytes at pBuf to Fd, in as many calls as that needs; a signal (EINTR) does not end
// it. Returns 0, or -1 with errno.
int WriteAll(int Fd, const void* pBuf, size_t Len);

}  // namespace fileops

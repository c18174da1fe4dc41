// File operations that must not leak a descriptor, lose errno or end the process. For the library
// itself and the programs built with it; not installed.
#pragma once

#include <cerrno>
#include <cstddef>
#include <string>

namespace fileops {

// Saves errno when constructed and restores it when destroyed.
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

// Disables cancellation of the calling thread when constructed and restores the previous state when
// destroyed. A request that arrives meanwhile waits for the thread's next cancellation point.
//
// Every destructor that calls a cancellation point (close, fclose, ...) needs one, because
// cancellation throws, and throwing in a destructor ends the whole process. Every call that opens a
// descriptor (open, fopen, ...) needs one, because a thread that is cancelled in it may lose the
// descriptor.
class NoCancel {
 public:
  NoCancel();
  ~NoCancel();
  NoCancel(const NoCancel&) = delete;
  NoCancel& operator=(const NoCancel&) = delete;

 private:
  int m_OldState;
};

// Owns a file descriptor, or none (-1).
class Descriptor {
 public:
  explicit Descriptor(int Fd) : m_Fd(Fd) {}

  // Closes the descriptor with cancellation disabled, and keeps errno.
  ~Descriptor();
  Descriptor(const Descriptor&) = delete;
  Descriptor& operator=(const Descriptor&) = delete;

  int Get() const { return m_Fd; }

  // Closes the descriptor, if there is one, with cancellation disabled. Returns 0, or -1 with
  // errno. Afterwards the object owns no descriptor.
  int Close();

 private:
  int m_Fd;
};

// Owns a temporary file. The destructor removes the file and keeps errno, unless RenameTo has given
// the file its final name. Does not own the file's descriptor.
class TmpFile {
 public:
  // Adopts the file strName, which the caller has created. An empty name means no file. Move the
  // name in: memory may run out for a copy, and nobody would remove the file then.
  explicit TmpFile(std::string strName) noexcept;
  ~TmpFile();
  TmpFile(const TmpFile&) = delete;
  TmpFile& operator=(const TmpFile&) = delete;

  // Empty if there is no file or RenameTo has succeeded.
  const char* Name() const { return m_strName.c_str(); }

  // Renames the file to szFile and replaces an existing file. Returns 0, or -1 with errno; the
  // object then still owns the file.
  int RenameTo(const char* szFile);

 private:
  std::string m_strName;
};

// Creates the file szName (mode 0600) and opens it for writing. First removes an existing file of
// that name. The caller must hold a lock that keeps others from creating it, so that only a killed
// process can have left such a file. Returns the descriptor, which the caller owns, or -1 with
// errno. Not a cancellation point.
int CreateAnew(const char* szName);

// Writes all Len bytes at pBuf to Fd, in as many calls as needed. Continues after a signal (EINTR).
// Returns 0, or -1 with errno.
int WriteAll(int Fd, const void* pBuf, size_t Len);

}  // namespace fileops

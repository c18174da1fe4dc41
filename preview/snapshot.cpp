// An ordinary connection would roll back a journal that a crash left, and would create or remove
// the files of a write-ahead log. So there are two ways:
// - If no other process uses a write-ahead log, copy the bytes of the database and of its journal
//   or log under a reader's lock. SQLite then recovers the copy.
// - If one does, log and database may change at any time. Let SQLite read them, with read-only
//   shared memory.
#include "snapshot.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cctype>
#include <cstdio>

#include "database.h"
#include "failure.h"
#include "files.h"

namespace {

constexpr int BUSY_TIMEOUT_MSEC = 5000;
constexpr int RETRY_MSEC = 10;

// The bytes that SQLite locks in a database file.
constexpr off_t PENDING_BYTE = 0x40000000;
constexpr off_t SHARED_FIRST = PENDING_BYTE + 2;
constexpr off_t SHARED_SIZE = 510;

int Lock(int Fd, int Command, off_t Start, off_t Size, struct flock* pLock) {
  pLock->l_whence = SEEK_SET;
  pLock->l_start = Start;
  pLock->l_len = Size;
  return fcntl(Fd, Command, pLock);
}

bool TryLockShared(int Fd) {
  struct flock Pending = {};
  struct flock Shared = {};
  Pending.l_type = Shared.l_type = F_RDLCK;
  if (Lock(Fd, F_SETLK, PENDING_BYTE, 1, &Pending) != 0) {
    return false;
  }
  const bool blLocked = Lock(Fd, F_SETLK, SHARED_FIRST, SHARED_SIZE, &Shared) == 0;
  const int Errno = errno;
  Pending.l_type = F_UNLCK;
  Lock(Fd, F_SETLK, PENDING_BYTE, 1, &Pending);
  errno = Errno;
  return blLocked;
}

[[noreturn]] void ThrowHeld(const std::string& strDatabase) {
  throw Failure(strDatabase + ": another process has held the database locked for five seconds");
}

// Keeps others from writing to the database file until the descriptor is closed.
void LockShared(int Fd, const std::string& strDatabase) {
  for (int Waited = 0; !TryLockShared(Fd); Waited += RETRY_MSEC) {
    if (errno != EAGAIN && errno != EACCES && errno != EINTR) {
      throw SystemFailure("cannot lock " + strDatabase);
    }
    if (Waited >= BUSY_TIMEOUT_MSEC) {
      ThrowHeld(strDatabase);
    }
    usleep(RETRY_MSEC * 1000);
  }
}

struct stat Status(int Fd, const std::string& strFile) {
  struct stat Stat;
  if (fstat(Fd, &Stat) != 0) {
    throw SystemFailure("cannot read " + strFile);
  }
  return Stat;
}

bool IsUnchanged(const struct stat& A, const struct stat& B) {
  return A.st_size == B.st_size && A.st_mtim.tv_sec == B.st_mtim.tv_sec &&
         A.st_mtim.tv_nsec == B.st_mtim.tv_nsec;
}

// A file that does not exist, or no longer, is not needed.
void CopyIfThere(const std::string& strFrom, const std::string& strTo) {
  const Descriptor From(open(strFrom.c_str(), O_RDONLY | O_CLOEXEC));
  if (From.Get() != -1) {
    CopyTo(From.Get(), strFrom, strTo, 0600);
  } else if (errno != ENOENT) {
    throw SystemFailure("cannot open " + strFrom);
  }
}

// An empty database cannot be in use. SQLite would remove its log.
bool IsLogInUse(const std::string& strDatabase, const struct stat& Stat) {
  return Stat.st_size > 0 && Exists(strDatabase + "-wal") && Exists(strDatabase + "-shm");
}

// Copies the bytes. Returns false if another process has begun to use a write-ahead log meanwhile:
// the lock does not keep it from writing.
bool CopyBytes(int Fd, const std::string& strDatabase, const std::string& strCopy) {
  const struct stat Before = Status(Fd, strDatabase);
  CopyTo(Fd, strDatabase, strCopy, 0600);
  CopyIfThere(strDatabase + "-journal", strCopy + "-journal");
  CopyIfThere(strDatabase + "-wal", strCopy + "-wal");
  const struct stat After = Status(Fd, strDatabase);
  return !IsLogInUse(strDatabase, After) && IsUnchanged(Before, After);
}

void RemoveCopy(const std::string& strCopy) {
  for (const char* szEnd : {"", "-journal", "-wal"}) {
    unlink((strCopy + szEnd).c_str());
  }
}

std::string ReadOnlyUri(const std::string& strDatabase) {
  std::string strUri = "file:";
  for (const char Char : strDatabase) {
    const auto Byte = static_cast<unsigned char>(Char);
    char szByte[4] = {Char, '\0', '\0', '\0'};
    if (isalnum(Byte) == 0 && Char != '/') {
      snprintf(szByte, sizeof(szByte), "%%%02X", Byte);
    }
    strUri += szByte;
  }
  return strUri + "?readonly_shm=1";
}

// Copies in one read transaction, so that the copy includes the write-ahead log.
void Backup(const std::string& strDatabase, const std::string& strCopy) {
  Database From(ReadOnlyUri(strDatabase), SQLITE_OPEN_READONLY | SQLITE_OPEN_URI);
  sqlite3_busy_timeout(From.Get(), BUSY_TIMEOUT_MSEC);
  From.Execute("BEGIN; SELECT count(*) FROM sqlite_schema");
  const Database To(strCopy, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE);
  sqlite3_backup* pBackup = sqlite3_backup_init(To.Get(), "main", From.Get(), "main");
  if (pBackup == nullptr) {
    To.Throw(sqlite3_errcode(To.Get()));
  }
  sqlite3_backup_step(pBackup, -1);
  const int Code = sqlite3_backup_finish(pBackup);
  if (Code != SQLITE_OK) {
    throw SqlFailure(Code, std::string("cannot copy: ") + sqlite3_errstr(Code));
  }
}

void CopyInUse(const std::string& strDatabase, const std::string& strCopy) {
  try {
    Backup(strDatabase, strCopy);
  } catch (const SqlFailure& Reason) {
    if (Reason.Code() == SQLITE_BUSY) {
      ThrowHeld(strDatabase);
    }
    if (Reason.Code() == SQLITE_CANTOPEN || Reason.Code() == SQLITE_READONLY) {
      throw Failure(strDatabase + ": its write-ahead log needs its owner: " + Reason.what() +
                    " (run this as the recorder's user, or stop the recorder first)");
    }
    throw;
  }
}

void CheckRegular(const std::string& strDatabase) {
  struct stat Stat;
  if (stat(strDatabase.c_str(), &Stat) != 0) {
    throw SystemFailure("cannot open " + strDatabase);
  }
  if (!S_ISREG(Stat.st_mode)) {
    throw Failure(strDatabase + (S_ISDIR(Stat.st_mode) ? " is a directory, not a database"
                                                       : " is not a regular file"));
  }
}

}  // namespace

void CopyDatabase(const std::string& strDatabase, const std::string& strCopy) {
  CheckRegular(strDatabase);
  for (int Waited = 0; Waited <= BUSY_TIMEOUT_MSEC; Waited += RETRY_MSEC) {
    // The lock also keeps the last user of a write-ahead log from removing it.
    const Descriptor File(OpenFile(strDatabase, O_RDONLY));
    LockShared(File.Get(), strDatabase);
    if (IsLogInUse(strDatabase, Status(File.Get(), strDatabase))) {
      CopyInUse(strDatabase, strCopy);
      return;
    }
    if (CopyBytes(File.Get(), strDatabase, strCopy)) {
      return;
    }
    RemoveCopy(strCopy);
    usleep(RETRY_MSEC * 1000);
  }
  throw Failure(strDatabase + " changes too often to be copied");
}

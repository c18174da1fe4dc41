#include "copy.h"

#include <sqlite3.h>
#include <sys/statvfs.h>

#include <cstdint>
#include <filesystem>
#include <fstream>
#include <iterator>

#include "database.h"
#include "failure.h"

namespace fs = std::filesystem;

namespace {

constexpr uintmax_t MAX_CAP_FILE_BYTES = uintmax_t{16} * 1024 * 1024;  // the tool reads no larger
constexpr uintmax_t MEGABYTE = 1000000;

bool IsCapFile(const fs::directory_entry& Entry) {
  std::error_code Error;  // a link that leads nowhere
  return Entry.path().filename() != ".zamoc.tmp" && Entry.is_regular_file(Error) &&
         Entry.file_size(Error) <= MAX_CAP_FILE_BYTES;
}

}  // namespace

void CheckRoom(const std::string& strDatabase, const std::string& strCaps) {
  // Two copies of the database, a journal or log of the tool's or as much for the changes, and some
  // pages more for their indexes.
  uintmax_t Needed = 3 * fs::file_size(strDatabase) + MEGABYTE;
  std::error_code Error;
  const uintmax_t Log = fs::file_size(strDatabase + "-wal", Error);
  Needed += Error ? 0 : 2 * Log;
  if (!strCaps.empty()) {
    for (const fs::directory_entry& Entry : fs::directory_iterator(strCaps)) {
      Needed += IsCapFile(Entry) ? 3 * Entry.file_size() : 0;
    }
  }
  struct statvfs Stat;
  if (statvfs(".", &Stat) != 0) {
    throw SystemFailure("cannot get the room in TMPDIR");
  }
  const uintmax_t Free = uintmax_t{Stat.f_bavail} * Stat.f_frsize;
  if (Free < Needed) {
    throw Failure("TMPDIR needs " + std::to_string(Needed / MEGABYTE + 1) + " MB, has " +
                  std::to_string(Free / MEGABYTE));
  }
}

int64_t CopyDatabase(const std::string& strFrom, const std::string& strTo) {
  try {
    const Database From(strFrom, SQLITE_OPEN_READWRITE);
    From.Execute("BEGIN");
    const std::string strVersion = From.Run("PRAGMA schema_version");
    const Database To(strTo, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE);
    To.Execute("PRAGMA synchronous = OFF");  // nobody needs the copy after a power cut
    From.CopyTo(To);
    return std::stoll(strVersion);
  } catch (const SqlFailure& Reason) {
    const bool blHeld = Reason.Code() == SQLITE_BUSY;
    throw Failure("cannot copy " + strFrom + ": " + Reason.what() +
                  (blHeld ? " (another process has held it for five seconds)" : ""));
  }
}

void CopyCapFiles(const std::string& strFrom, const std::string& strTo) {
  for (const fs::directory_entry& Entry : fs::directory_iterator(strFrom)) {
    if (IsCapFile(Entry)) {
      fs::copy_file(Entry, strTo / Entry.path().filename());
    }
  }
}

std::string ReadFile(const std::string& strFile) {
  std::ifstream Stream(strFile, std::ios::binary);
  std::string strContent(std::istreambuf_iterator<char>(Stream), {});
  if (!Stream.is_open() || Stream.bad()) {
    throw SystemFailure("cannot read " + strFile);
  }
  return strContent;
}

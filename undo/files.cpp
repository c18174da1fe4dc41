#include "files.h"

#include <unistd.h>

#include <cstdio>
#include <optional>
#include <string_view>

#include "capfile.h"
#include "value.h"

namespace {

using Content = std::optional<std::string_view>;  // none: there is no such file

// The bytes live until the next step of the statement.
Content Bytes(const Statement& Row, int Column) {
  if (sqlite3_column_type(Row.Get(), Column) == SQLITE_NULL) {
    return {};
  }
  const auto* pBytes = static_cast<const char*>(sqlite3_column_blob(Row.Get(), Column));
  return std::string_view(pBytes, static_cast<size_t>(sqlite3_column_bytes(Row.Get(), Column)));
}

std::string Size(const Content& Bytes) {
  return Bytes ? std::to_string(Bytes->size()) + " bytes" : "none";
}

struct Change {
  std::string strFile;
  Content Before;
  Content After;
  std::string strNow;
  Content Now;
};

// Returns why the file is left, or "".
std::string Restore(bool blDryRun, Change* pChange, Counts* pCounts) {
  capfile::LockedFile File;
  if (!blDryRun && File.Lock(pChange->strFile.c_str()) != 0) {
    return SystemFailure(File.Step()).what();
  }
  struct stat Stat = {};
  Stat.st_mode = 0644;  // of a file that comes back
  Stat.st_uid = geteuid();
  Stat.st_gid = getegid();
  if (capfile::Read(pChange->strFile, &pChange->strNow, &Stat) == capfile::ReadResult::Read) {
    pChange->Now = pChange->strNow;
  } else if (errno != ENOENT) {
    return SystemFailure("cannot be read").what();
  }
  if (pChange->Now == pChange->Before) {
    ++pCounts->Done;
    return "";
  }
  if (pChange->Now != pChange->After) {
    return "it has been changed since";
  }
  if (!blDryRun && (pChange->Before ? File.Replace(*pChange->Before, Stat) : File.Remove()) != 0) {
    return SystemFailure(File.Step()).what();
  }
  ++pCounts->Back;
  return "";
}

}  // namespace

void RestoreFiles(const Database& Changes, const std::string& strDir, bool blDryRun,
                  Counts* pCounts) {
  // A name with a slash would lead out of the directory.
  Statement Files(Changes, "SELECT name, before, after FROM file WHERE name NOT LIKE '%/%'");
  while (Files.Step()) {
    Change Change = {strDir + "/" + Files.Text(0), Bytes(Files, 1), Bytes(Files, 2), "", {}};
    const std::string strReason = Restore(blDryRun, &Change, pCounts);
    if (!strReason.empty()) {
      ++pCounts->Left;
      printf("left: file %s: before %s, after %s, now %s (%s)\n", Name(Files.Text(0)).c_str(),
             Size(Change.Before).c_str(), Size(Change.After).c_str(), Size(Change.Now).c_str(),
             strReason.c_str());
    }
  }
}

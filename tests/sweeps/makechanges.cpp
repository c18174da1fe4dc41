// makechanges FILE BEFORE AFTER DATABASE [CAPS-BEFORE CAPS-AFTER]
//
// Makes the change file FILE of the databases BEFORE and AFTER and of two directories of capability
// files. It belongs to DATABASE. All names are absolute.

#include <sys/stat.h>

#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>

#include "changefile.h"

namespace {

std::string ReadFile(const std::filesystem::path& File) {
  std::ifstream Stream(File, std::ios::binary);
  return {std::istreambuf_iterator<char>(Stream), {}};
}

void AddFiles(const std::string& strFile, const std::filesystem::path& Before,
              const std::filesystem::path& After) {
  const Database Changes(strFile, SQLITE_OPEN_READWRITE);
  for (const auto& Entry : std::filesystem::directory_iterator(After)) {
    const std::filesystem::path Name = Entry.path().filename();
    const auto strBefore = ReadFile(Before / Name);
    const auto strAfter = ReadFile(Entry.path());
    if (strBefore != strAfter) {
      AddFile(Changes, Name, strBefore, strAfter);
    }
  }
}

Upgrade Describe(const std::string& strDatabase) {
  struct stat Stat = {};
  stat(strDatabase.c_str(), &Stat);
  const Database Db(strDatabase, SQLITE_OPEN_READWRITE);
  const int64_t SchemaVersion = std::stoll(Db.Run("PRAGMA schema_version"));
  return {"400", "tool", "1", strDatabase, static_cast<int64_t>(Stat.st_ino), SchemaVersion};
}

}  // namespace

int main(int argc, char* argv[]) {
  try {
    MakeChangeFile(argv[1], argv[2], argv[3], Describe(argv[4]));
    if (argc > 5) {
      AddFiles(argv[1], argv[5], argv[6]);
    }
    return 0;
  } catch (const std::exception& Reason) {
    fprintf(stderr, "makechanges: %s\n", Reason.what());
    return 2;
  }
}

// Takes back what an upgrade has changed, as a change file says.

#include <getopt.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cinttypes>
#include <climits>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <string>
#include <vector>

#include "changefile.h"
#include "files.h"
#include "references.h"
#include "rows.h"
#include "value.h"

namespace {

constexpr int ALL_IS_BACK = 0;
constexpr int NOTHING_DONE = 2;
constexpr int SOMETHING_LEFT = 3;

constexpr const char* DEFAULT_DATABASE = "/var/packages/Camveld/target/system.db";

constexpr const char* HELP =
    "Usage: tessel-undo [OPTION]... FILE [DATABASE]\n"
    "Takes back the upgrade whose changes FILE holds.\n"
    "\n"
    "  --dry-run      print the same, and change nothing\n"
    "  --force        take it back even if FILE belongs to another database\n"
    "  --caps DIR     the capability files, by default @camveld/@KICapInfo beside DATABASE\n"
    "  -h, --help     print this\n"
    "  -V, --version  print the version\n"
    "\n"
    "Status: 0 all is back, 3 something was left, 2 nothing was done.\n";

struct CommandLine {
  std::string strFile;
  std::string strDatabase = DEFAULT_DATABASE;
  std::string strCaps;
  bool blDryRun = false;
  bool blForce = false;
};

// Ends the program if there is nothing to do.
CommandLine ParseOptions(int argc, char* argv[]) {
  constexpr option LongOptions[] = {
      {"dry-run", no_argument, nullptr, 'n'},    {"force", no_argument, nullptr, 'f'},
      {"caps", required_argument, nullptr, 'c'}, {"help", no_argument, nullptr, 'h'},
      {"version", no_argument, nullptr, 'V'},    {nullptr, 0, nullptr, 0}};
  CommandLine Options;
  int Option;
  while ((Option = getopt_long(argc, argv, "hV", LongOptions, nullptr)) != -1) {
    switch (Option) {
      case 'n':
        Options.blDryRun = true;
        break;
      case 'f':
        Options.blForce = true;
        break;
      case 'c':
        Options.strCaps = optarg;
        break;
      case 'h':
      case 'V':
        fputs(Option == 'h' ? HELP : "tessel-undo " TESSEL_VERSION "\n", stdout);
        exit(fflush(stdout) == 0 ? ALL_IS_BACK : NOTHING_DONE);
      default:
        exit(NOTHING_DONE);  // getopt has printed the reason
    }
  }
  if (optind == argc || argc - optind > 2) {
    throw Failure(optind == argc ? "FILE is missing (--help says more)"
                                 : "too many arguments (--help says more)");
  }
  Options.strFile = argv[optind];
  if (argc - optind == 2) {
    Options.strDatabase = argv[optind + 1];
  }
  return Options;
}

// --- Files ---

std::string RealPath(const std::string& strFile) {
  const std::unique_ptr<char, decltype(&free)> pReal(realpath(strFile.c_str(), nullptr), free);
  if (pReal == nullptr) {
    throw SystemFailure("cannot open " + strFile);
  }
  return pReal.get();
}

struct stat Status(const std::string& strFile) {
  struct stat Stat;
  if (stat(strFile.c_str(), &Stat) != 0) {
    throw SystemFailure("cannot open " + strFile);
  }
  return Stat;
}

std::string DirectoryOf(const std::string& strFile) {
  const size_t Slash = strFile.rfind('/');
  return Slash == std::string::npos ? "./" : strFile.substr(0, Slash + 1);
}

// Nobody else may say what is written into the database.
void CheckPrivate(const std::string& strFile) {
  for (const std::string& strPart : {strFile, DirectoryOf(strFile)}) {
    const struct stat Stat = Status(strPart);
    const bool blSticky = S_ISDIR(Stat.st_mode) && (Stat.st_mode & S_ISVTX) != 0;
    const bool blOwn = Stat.st_uid == 0 || Stat.st_uid == geteuid();
    if (!blOwn || ((Stat.st_mode & (S_IWGRP | S_IWOTH)) != 0 && !blSticky)) {
      throw Failure("others can write " + strPart);
    }
  }
  if (!S_ISREG(Status(strFile).st_mode)) {
    throw Failure(strFile + " is not a regular file");
  }
}

void CheckDatabase(const std::string& strDatabase, const Upgrade& Upgrade, bool blForce) {
  const struct stat Stat = Status(strDatabase);
  if (!S_ISREG(Stat.st_mode)) {
    throw Failure(strDatabase + " is not a regular file");
  }
  const bool blSame =
      strDatabase == Upgrade.strDatabase && static_cast<int64_t>(Stat.st_ino) == Upgrade.Inode;
  if (!blSame && !blForce) {
    throw Failure(strDatabase == Upgrade.strDatabase
                      ? strDatabase + " has been replaced since (--force takes back all the same)"
                      : "the file belongs to " + Upgrade.strDatabase + ", not to " + strDatabase +
                            " (--force takes back all the same)");
  }
}

// By default, the capability files are beside DATABASE, even if that is a link.
std::string FindCaps(const CommandLine& Options) {
  if (Options.strCaps.empty()) {
    return DirectoryOf(Options.strDatabase) + "@camveld/@KICapInfo";
  }
  if (!S_ISDIR(Status(Options.strCaps).st_mode)) {
    throw Failure(Options.strCaps + " is not a directory");
  }
  return Options.strCaps;
}

// --- The database ---

// Takes back all rows that can go back, and leaves the transaction open. A row that cannot, because
// of what others have done since, shows only when all have: then they go back without it.
std::vector<TableUndo> TakeBack(const Database& Db, const std::vector<ChangedTable>& Changed,
                                bool blRebuilt) {
  std::vector<TableUndo> Tables;
  for (const ChangedTable& Table : Changed) {
    if (Table.strReason.empty()) {
      Tables.emplace_back(Db, Table, blRebuilt).Classify();
    }
  }
  const References References(Db, Tables);
  while (true) {
    Db.Execute("SAVEPOINT attempt");
    std::vector<LeftRow> Left;
    for (const TableUndo& Table : Tables) {
      Table.Apply(&Left);
    }
    std::vector<BrokenReference> Broken;
    if (Left.empty()) {
      Broken = References.Check(&Left);
    }
    if (Left.empty() && Broken.empty()) {
      return Tables;
    }
    Db.Execute("ROLLBACK TO attempt");
    References.FindParents(Broken, &Left);
    for (const TableUndo& Table : Tables) {
      Table.Leave(Left);
    }
  }
}

// Prints what is left. Nothing is printed of a database where all went back.
Counts UndoDatabase(Database* pDb, const Database& Original, const std::string& strFile,
                    const Database& Changes) {
  AddPrintFunctions(*pDb);
  pDb->AttachReadOnly(strFile, "changes");
  const std::vector<ChangedTable> Changed = ReadTables(Changes);
  pDb->Execute("BEGIN IMMEDIATE");
  const bool blRebuilt =
      Original.Run("PRAGMA schema_version") != std::to_string(ReadUpgrade(Changes).SchemaVersion);
  const std::vector<TableUndo> Tables = TakeBack(*pDb, Changed, blRebuilt);
  Counts Counts;
  for (const ChangedTable& Table : Changed) {
    if (!Table.strReason.empty()) {
      printf("not in the undo: %s (%s)\n", Name(Table.strName).c_str(),
             Name(Table.strReason).c_str());
      Counts.Left += Table.blDoubt ? 1 : 0;
    }
  }
  for (const TableUndo& Table : Tables) {
    Table.Print(&Counts);
  }
  return Counts;
}

int Undo(const CommandLine& Options) {
  const std::string strFile = RealPath(Options.strFile);
  CheckPrivate(strFile);
  const Database Changes(strFile, SQLITE_OPEN_READONLY);
  const std::string strDatabase = RealPath(Options.strDatabase);
  CheckDatabase(strDatabase, ReadUpgrade(Changes), Options.blForce);
  const std::string strCaps = FindCaps(Options);
  Counts Counts;
  try {
    Database Db(strDatabase, SQLITE_OPEN_READWRITE);
    if (Options.blDryRun) {
      Database Copy("", SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE);  // SQLite removes it again
      Db.CopyTo(Copy);
      Counts = UndoDatabase(&Copy, Db, strFile, Changes);
    } else {
      Db.Execute("PRAGMA synchronous = EXTRA");
      Counts = UndoDatabase(&Db, Db, strFile, Changes);
      Db.Execute("COMMIT");
    }
  } catch (const SqlFailure& Reason) {
    throw Failure(strDatabase + ": " +
                  (Reason.Code() == SQLITE_BUSY
                       ? "another process has held it locked for five seconds"
                       : Reason.what()));
  }
  // From here on, something is done. A failure leaves a file, which is named.
  RestoreFiles(Changes, strCaps, Options.blDryRun, &Counts);
  printf("%" PRId64 " set back, %" PRId64 " left, %" PRId64 " already as before\n", Counts.Back,
         Counts.Left, Counts.Done);
  if (fflush(stdout) != 0 || ferror(stdout) != 0) {
    fprintf(stderr, "tessel-undo: %s\n", SystemFailure("cannot write the output").what());
  }
  return Counts.Left == 0 ? ALL_IS_BACK : SOMETHING_LEFT;
}

}  // namespace

int main(int argc, char* argv[]) {
  // Nobody need read the output to the end.
  signal(SIGPIPE, SIG_IGN);
  try {
    return Undo(ParseOptions(argc, argv));
  } catch (const std::exception& Reason) {
    fflush(stdout);
    fprintf(stderr, "tessel-undo: %s\n", Name(Reason.what()).c_str());
    return NOTHING_DONE;
  }
}

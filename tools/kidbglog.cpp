// Shows and changes the shared configuration that decides what the processes of the package log.

#include <fcntl.h>
#include <getopt.h>
#include <signal.h>
#include <sys/shm.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <numeric>
#include <string>
#include <vector>

#include "kidebuglog.h"
#include "kiflock.h"
#include "settings.h"
#include "utils.h"

namespace {

constexpr const char* PACKAGE_DIR = "/var/packages/Camveld";
constexpr int LOCK_TIMEOUT_SEC = 10;
constexpr LOG_LEVEL DEFAULT_LEVEL = LOG_LEVEL_NOTICE;

constexpr char USAGE[] =
    "Usage: kidbglog [show [--all]]                     what is logged\n"
    "       kidbglog set CATEGORY[,CATEGORY...] LEVEL   the threshold of categories, or of 'all'\n"
    "       kidbglog pid PID LEVEL                      the threshold of one process\n"
    "       kidbglog pid PID clear                      remove it\n"
    "       kidbglog ms on|off                          times with milliseconds\n"
    "       kidbglog create                             create and initialise the configuration\n"
    "       kidbglog load                               read the settings file\n"
    "       kidbglog save                               write the settings file\n"
    "A CATEGORY and a LEVEL are a name or a number; show --all lists the categories.\n"
    "Levels: 0 alarm, 1 error, 2 warn, 3 notice, 4 info, 5 debug, 6 debug2, 7 debug3.\n";

// The exit statuses other than 0.
enum ExitStatus : int { REFUSED = 1, MISUSED = 2 };

// Prints one line to standard error and ends the program.
[[noreturn]] __attribute__((format(printf, 2, 3))) void Fail(ExitStatus Status,
                                                             const char* szFormat, ...) {
  fputs("kidbglog: ", stderr);
  va_list Args;
  va_start(Args, szFormat);
  vfprintf(stderr, szFormat, Args);
  va_end(Args);
  fputc('\n', stderr);
  exit(Status);
}

void FinishOutput() {
  if (fflush(stdout) != 0) {
    Fail(REFUSED, "cannot write: %s", strerror(errno));
  }
  if (ferror(stdout) != 0) {
    Fail(REFUSED, "cannot write: a part of the output is lost");
  }
}

// --- Names ---

// Returns how many insertions, deletions and replacements turn one text into the other.
size_t EditDistance(const std::string& strFrom, const std::string& strTo) {
  std::vector<size_t> Row(strTo.size() + 1);
  std::iota(Row.begin(), Row.end(), 0);
  for (const char From : strFrom) {
    size_t Diagonal = Row[0]++;
    for (size_t To = 0; To < strTo.size(); ++To) {
      const size_t Replaced = Diagonal + (From == strTo[To] ? 0 : 1);
      Diagonal = Row[To + 1];
      Row[To + 1] = std::min({Replaced, Row[To] + 1, Diagonal + 1});
    }
  }
  return Row.back();
}

std::string ToLower(std::string strText) {
  for (char& Letter : strText) {
    Letter = Letter >= 'A' && Letter <= 'Z' ? static_cast<char>(Letter - 'A' + 'a') : Letter;
  }
  return strText;
}

// Returns the value of T, below Total, whose name or number is strText. Ends the program if none
// is, with the nearest name, if one is near in whatever case.
template <typename T>
T Parse(const char* szKind, const std::string& strText, T Total) {
  const std::string strLower = ToLower(strText);
  size_t NearestDistance = std::min<size_t>(3, (strText.size() + 1) / 2) + 1;
  std::string strHint = ", see 'kidbglog --help'";
  for (int Number = 0; Number < Total; ++Number) {
    const std::string strName = Enum2String(static_cast<T>(Number));
    if (strText == strName || strText == itos(Number)) {
      return static_cast<T>(Number);
    }
    const size_t Distance = EditDistance(strLower, strName);
    if (Distance < NearestDistance) {
      NearestDistance = Distance;
      strHint = ", the nearest is '" + strName + "'";
    }
  }
  Fail(MISUSED, "no %s '%s'%s", szKind, strText.c_str(), strHint.c_str());
}

LOG_LEVEL ParseLevel(const std::string& strText) {
  return Parse("level", strText, LOG_LEVEL_TOTAL);
}

// Returns the categories of a list with commas.
std::vector<LOG_CATEG> ParseCategs(const std::string& strList) {
  std::vector<LOG_CATEG> Categs;
  if (strList == "all") {
    for (int Number = 0; Number < LOG_CATEG_TOTAL; ++Number) {
      Categs.push_back(static_cast<LOG_CATEG>(Number));
    }
    return Categs;
  }
  size_t Begin = 0;
  size_t Comma = 0;
  do {
    Comma = strList.find(',', Begin);
    const std::string strName = strList.substr(Begin, Comma - Begin);
    Categs.push_back(Parse("category", strName, LOG_CATEG_TOTAL));
    Begin = Comma + 1;
  } while (Comma != std::string::npos);
  return Categs;
}

// Another program may have stored a number that is not a level.
std::string LevelText(LOG_LEVEL Level) {
  return Level >= 0 && Level < LOG_LEVEL_TOTAL ? Enum2String(Level) : itos(Level);
}

// --- The configuration and its processes ---

KiDbgLogCfg& Attach() {
  KiDbgLogCfg* const pCfg = KiShmDbgLogCfgAt();
  if (pCfg == nullptr) {
    Fail(REFUSED, "cannot attach the configuration: %s",
         errno == ENOENT ? "there is none, 'kidbglog create' creates it" : strerror(errno));
  }
  shmid_ds Info;
  if (shmctl(shmget(KiShmDbgLogIPCKey(), 0, 0), IPC_STAT, &Info) != 0) {
    Fail(REFUSED, "cannot get the segment's size: %s", strerror(errno));
  }
  if (Info.shm_segsz < sizeof(KiDbgLogCfg)) {
    Fail(REFUSED, "the segment has %zu bytes, not %zu", size_t{Info.shm_segsz},
         sizeof(KiDbgLogCfg));
  }
  return *pCfg;
}

// Returns the table of processes.
std::vector<__PidDbgLevel> Entries(const KiDbgLogCfg& Cfg) {
  std::vector<__PidDbgLevel> Table;
  __PidDbgLevel Entry = {};
  while (Cfg.GetPidLevel(static_cast<int>(Table.size()), Entry.Pid, Entry.Level) == 0) {
    Table.push_back(Entry);
  }
  return Table;
}

bool HasEntry(const KiDbgLogCfg& Cfg, pid_t Pid) {
  const std::vector<__PidDbgLevel> Table = Entries(Cfg);
  return std::any_of(Table.begin(), Table.end(),
                     [Pid](const __PidDbgLevel& Entry) { return Entry.Pid == Pid; });
}

// Whether Pid is a process. The id of a thread is none: kill takes it for its process, but no
// process looks for its threshold under it.
bool IsRunning(pid_t Pid) {
  if (Pid <= 0 || (kill(Pid, 0) != 0 && errno != EPERM)) {
    return false;
  }
  std::ifstream Status("/proc/" + itos(Pid) + "/status");
  for (std::string strLine; std::getline(Status, strLine);) {
    if (strLine.compare(0, 5, "Tgid:") == 0) {
      return Trim(strLine.substr(5), "\t ") == itos(Pid);
    }
  }
  return true;  // /proc can hide the processes of other users
}

// Replaces control characters: a process can choose a name that would control the terminal.
std::string ProcessName(pid_t Pid) {
  char szName[64] = "?";
  if (FILE* pFile = fopen(("/proc/" + itos(Pid) + "/comm").c_str(), "re")) {
    szName[fread(szName, 1, sizeof(szName) - 1, pFile)] = '\0';
    fclose(pFile);
  }
  std::string strName = Trim(szName, "\n");
  for (char& Byte : strName) {
    Byte = Byte < ' ' || Byte > '~' ? '?' : Byte;
  }
  return strName;
}

// --- The commands ---

// What stands behind the name of a command.
struct Arguments {
  std::vector<std::string> Words;
  bool blAll = false;  // the option --all
};

void Show(const Arguments& Args) {
  const KiDbgLogCfg& Cfg = Attach();
  int Shown = 0;
  for (int Number = 0; Number < LOG_CATEG_TOTAL; ++Number) {
    const auto Categ = static_cast<LOG_CATEG>(Number);
    const LOG_LEVEL Level = Cfg.GetLogLevel(Categ);
    if (Args.blAll || Level != DEFAULT_LEVEL) {
      printf("category %d (%s): %s\n", Number, Enum2String(Categ), LevelText(Level).c_str());
      ++Shown;
    }
  }
  if (Shown < LOG_CATEG_TOTAL) {
    printf("%s categories: %s\n", Shown == 0 ? "all" : "other", Enum2String(DEFAULT_LEVEL));
  }
  for (const auto& [Pid, Level] : Entries(Cfg)) {
    const std::string strName = IsRunning(Pid) ? " (" + ProcessName(Pid) + ")" : ", gone";
    printf("process %d%s: %s\n", Pid, strName.c_str(), LevelText(Level).c_str());
  }
  printf("milliseconds: %s\n", Cfg.LogInMs() ? "on" : "off");
}

void Set(const Arguments& Args) {
  const std::vector<LOG_CATEG> Categs = ParseCategs(Args.Words[0]);
  const LOG_LEVEL Level = ParseLevel(Args.Words[1]);
  KiDbgLogCfg& Cfg = Attach();
  for (const LOG_CATEG Categ : Categs) {
    Cfg.SetLogLevel(Categ, Level);
  }
}

void ClearPid(pid_t Pid) {
  KiDbgLogCfg& Cfg = Attach();
  if (!HasEntry(Cfg, Pid)) {
    Fail(REFUSED, "process %d has no threshold of its own", Pid);
  }
  Cfg.ClearPid(Pid);
}

void ClearGone(KiDbgLogCfg& Cfg) {
  for (const __PidDbgLevel& Entry : Entries(Cfg)) {
    if (!IsRunning(Entry.Pid)) {
      Cfg.ClearPid(Entry.Pid);
      printf("the table of processes was full: cleared process %d, which is gone\n", Entry.Pid);
    }
  }
}

void SetPid(pid_t Pid, LOG_LEVEL Level) {
  KiDbgLogCfg& Cfg = Attach();
  if (!IsRunning(Pid)) {
    Fail(REFUSED, "there is no process %d", Pid);
  }
  Cfg.SetPidLevel(Pid, Level);
  if (!HasEntry(Cfg, Pid)) {  // the table is full
    ClearGone(Cfg);
    Cfg.SetPidLevel(Pid, Level);
  }
  if (!HasEntry(Cfg, Pid)) {
    Fail(REFUSED, "the table of processes is full, 'kidbglog pid PID clear' makes room");
  }
}

void ChangePid(const Arguments& Args) {
  const std::string& strPid = Args.Words[0];
  const std::string& strLevel = Args.Words[1];
  const auto Pid = static_cast<pid_t>(strtol(strPid.c_str(), nullptr, 10));
  if (Pid <= 0 || itos(Pid) != strPid) {
    Fail(MISUSED, "not a process id: '%s'", strPid.c_str());
  }
  if (strLevel == "clear") {
    ClearPid(Pid);
  } else {
    SetPid(Pid, ParseLevel(strLevel));
  }
}

void SetMs(const Arguments& Args) {
  const std::string& strSwitch = Args.Words[0];
  if (strSwitch != "on" && strSwitch != "off") {
    Fail(MISUSED, "milliseconds are on or off, not '%s'", strSwitch.c_str());
  }
  Attach().SetLogInMs(strSwitch == "on");
}

// The library would open a pipe, and wait for its other end while this command holds the lock.
void CheckSettingsFile() {
  struct stat Stat;
  if (stat(SETTINGS_FILE, &Stat) == 0 && !S_ISREG(Stat.st_mode)) {
    Fail(REFUSED, "%s is not a regular file", SETTINGS_FILE);
  }
}

void Create(const Arguments& /*Args*/) {
  CheckSettingsFile();
  int Id = shmget(KiShmDbgLogIPCKey(), 0, 0);
  if (Id == -1 && errno == ENOENT) {
    Id = shmget(KiShmDbgLogIPCKey(), sizeof(KiDbgLogCfg), IPC_CREAT | 0666);
  }
  shmid_ds Info;
  if (Id == -1 || shmctl(Id, IPC_STAT, &Info) != 0) {
    Fail(REFUSED, "cannot create the configuration: %s", strerror(errno));
  }
  if (Info.shm_segsz < sizeof(KiDbgLogCfg)) {
    Fail(REFUSED, "there is a segment of %zu bytes already, %zu are needed", size_t{Info.shm_segsz},
         sizeof(KiDbgLogCfg));
  }
  const bool blForAll = (Info.shm_perm.mode & 0777) == 0666;
  Info.shm_perm.mode = 0666;
  if (!blForAll && shmctl(Id, IPC_SET, &Info) != 0) {
    Fail(REFUSED, "cannot open the segment to all processes: %s", strerror(errno));
  }
  KiDbgLogCfg& Cfg = Attach();
  Cfg.Init(KiShmDbgLogIPCKey());
  // Init does not report whether it could read the settings. ENOENT: the directory is missing, so
  // there are none.
  if (Cfg.LoadDbgLogSettings() < 0 && errno != ENOENT) {
    Fail(REFUSED, "created with the defaults, cannot read %s: %s", SETTINGS_FILE, strerror(errno));
  }
}

void Load(const Arguments& /*Args*/) {
  CheckSettingsFile();
  const int Found = Attach().LoadDbgLogSettings();
  if (Found <= 0) {
    Fail(REFUSED, "nothing loaded from %s: %s", SETTINGS_FILE,
         Found == 0 ? "it holds no saved settings" : strerror(errno));
  }
}

void Save(const Arguments& /*Args*/) {
  CheckSettingsFile();
  if (Attach().SaveDbgLogSettings() != 0) {
    Fail(REFUSED, "cannot write %s: %s", SETTINGS_FILE, strerror(errno));
  }
}

struct CommandRow {
  const char* szName;
  size_t Words;     // how many words it takes
  bool blTakesAll;  // whether it takes the option --all
  bool blChanges;   // whether it needs the lock
  void (*pRun)(const Arguments& Args);
};

constexpr CommandRow rgCommand[] = {
    {"show", 0, true, false, Show},     {"set", 2, false, true, Set},
    {"pid", 2, false, true, ChangePid}, {"ms", 1, false, true, SetMs},
    {"create", 0, false, true, Create}, {"load", 0, false, true, Load},
    {"save", 0, false, true, Save},
};

CommandRow FindCommand(const std::string& strName) {
  for (const CommandRow& Command : rgCommand) {
    if (strName == Command.szName) {
      return Command;
    }
  }
  Fail(MISUSED, "no command '%s', see 'kidbglog --help'", strName.c_str());
}

// Keeps other kidbglog commands waiting until this program ends. The configuration has no lock of
// its own, so one of two processes that are added at the same moment would be lost. If the user may
// not open the directory, there is no lock.
void Lock() {
  const int Fd = open(PACKAGE_DIR, O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (Fd == -1 || KiFlock::Lock(Fd, LOCK_TIMEOUT_SEC, true) == 0) {
    return;
  }
  if (errno == EWOULDBLOCK) {
    Fail(REFUSED, "another command has held the lock on %s for %d seconds", PACKAGE_DIR,
         LOCK_TIMEOUT_SEC);
  }
  Fail(REFUSED, "cannot lock %s: %s", PACKAGE_DIR, strerror(errno));
}

}  // namespace

int main(int argc, char* argv[]) {
  static const option rgOption[] = {
      {"all", no_argument, nullptr, 'a'},
      {"help", no_argument, nullptr, 'h'},
      {"version", no_argument, nullptr, 'V'},
      {},
  };
  Arguments Args;
  for (int Option; (Option = getopt_long(argc, argv, "", rgOption, nullptr)) != -1;) {
    switch (Option) {
      case 'a':
        Args.blAll = true;
        break;
      case 'h':
        fputs(USAGE, stdout);
        FinishOutput();
        return 0;
      case 'V':
        puts("kidbglog " VERSION);
        FinishOutput();
        return 0;
      default:  // getopt_long has printed the reason
        return MISUSED;
    }
  }
  std::string strName = "show";
  if (optind < argc) {
    strName = argv[optind++];
  }
  Args.Words.assign(argv + optind, argv + argc);
  const CommandRow Command = FindCommand(strName);
  if (Args.Words.size() != Command.Words || (Args.blAll && !Command.blTakesAll)) {
    Fail(MISUSED, "wrong arguments for '%s', see 'kidbglog --help'", Command.szName);
  }
  if (Command.blChanges) {
    Lock();
  }
  Command.pRun(Args);
  FinishOutput();
}

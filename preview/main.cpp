// Runs the tool on a copy of the appliance and shows what it changes there.

#include <sys/stat.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <optional>
#include <set>

#include "cause.h"
#include "changefile.h"
#include "copy.h"
#include "failure.h"
#include "keep.h"
#include "options.h"
#include "process.h"
#include "report.h"
#include "tool.h"
#include "value.h"

namespace fs = std::filesystem;

namespace {

constexpr int NO_PREVIEW = 2;
constexpr int WOULD_CHANGE = 3;

// Names in the work directory, which is the current directory.
constexpr const char* TARGET = "target";
constexpr const char* BEFORE_DATABASE = "before.db";
constexpr const char* AFTER_DATABASE = "target/system.db";
constexpr const char* BEFORE_CAPS = "before";
constexpr const char* AFTER_CAPS = "after";
constexpr const char* AFTER_CAPS_TARGET = "target/@camveld/@KICapInfo";
constexpr const char* CHANGES = "changes";

std::string Absolute(const char* szName) { return fs::absolute(szName); }

int64_t InodeOf(const std::string& strFile) {
  struct stat Stat;
  if (stat(strFile.c_str(), &Stat) != 0) {
    throw SystemFailure("cannot open " + strFile);
  }
  return static_cast<int64_t>(Stat.st_ino);
}

// Copies the appliance, and describes the upgrade that the tool will make of the copy.
Upgrade CopyAppliance(const CommandLine& Options, const Tool& Tool) {
  CheckRoom(Options.strDatabase, Options.strCaps);
  Upgrade Info;
  Info.strVersion = Options.strVersion;
  Info.strTool = Tool.File();
  Info.strToolVersion = Tool.Banner();
  Info.strDatabase = Options.strDatabase;
  Info.Inode = InodeOf(Options.strDatabase);
  Info.SchemaVersion = CopyDatabase(Options.strDatabase, Absolute(BEFORE_DATABASE));
  CopyDatabase(Absolute(BEFORE_DATABASE), Absolute(AFTER_DATABASE));
  fs::create_directory(BEFORE_CAPS);
  fs::create_directories(AFTER_CAPS_TARGET);
  fs::create_directory_symlink(AFTER_CAPS_TARGET, AFTER_CAPS);
  if (!Options.strCaps.empty()) {
    CopyCapFiles(Options.strCaps, BEFORE_CAPS);
    CopyCapFiles(BEFORE_CAPS, AFTER_CAPS);
  }
  return Info;
}

std::string InDirectory(const char* szDir, const std::string& strName) {
  return szDir + ("/" + strName);
}

// Adds the capability files that differ.
void StoreFiles(const Database& Changes) {
  for (const fs::directory_entry& Entry : fs::directory_iterator(BEFORE_CAPS)) {
    const std::string strName = Entry.path().filename();
    const std::string strBefore = ReadFile(Entry.path());
    const std::string strAfter = ReadFile(InDirectory(AFTER_CAPS, strName));
    if (strBefore != strAfter) {
      AddFile(Changes, strName, strBefore, strAfter);
    }
  }
}

// Returns what diff(1) says of a capability file.
std::string Diff(const std::string& strName) {
  const std::string strBefore = InDirectory(BEFORE_CAPS, strName);
  const std::string strAfter = InDirectory(AFTER_CAPS, strName);
  const CommandResult Result =
      RunCommand({"diff", "--unified", "--text", "--label=" + Name(strBefore),
                  "--label=" + Name(strAfter), "--", strBefore, strAfter});
  if (Result.Status != 1) {
    throw Failure("cannot compare capability files: " +
                  Result.strOutput.substr(0, Result.strOutput.find('\n')));
  }
  return Result.strOutput;
}

void ReportFailures(const std::vector<FailedAction>& Failures, bool blShown, Report* pReport) {
  std::set<std::string> Actions;
  for (const FailedAction& Failed : Failures) {
    if (blShown) {
      pReport->Failed(Failed, FindCause(Absolute(BEFORE_DATABASE), Failed.strSqlCmd));
    }
    Actions.insert(Failed.strName);
  }
  pReport->m_Counts.Failed = static_cast<int64_t>(Actions.size());
}

// --check tells what is sure: a failure and a doubt win over a change.
int CheckStatus(const Report& Report, bool blDoubt, int ToolStatus) {
  if (ToolStatus != 0) {
    return ToolStatus;
  }
  if (blDoubt) {
    return NO_PREVIEW;
  }
  return Report.m_Counts.IsEmpty() ? 0 : WOULD_CHANGE;
}

int PreviewUpgrade(const CommandLine& Options) {
  const Tool Tool(Options.strTool, Options.strOwnDir, TARGET);
  std::optional<KeptFile> Kept;
  if (!Options.strUndo.empty()) {
    Kept.emplace(Options.strUndo);
  }
  const Upgrade Info = CopyAppliance(Options, Tool);
  const UpgradeRun Run = Tool.Upgrade(Options.strVersion);
  MakeChangeFile(Absolute(CHANGES), Absolute(BEFORE_DATABASE), Absolute(AFTER_DATABASE), Info);
  const Database Changes(Absolute(CHANGES), SQLITE_OPEN_READWRITE);
  StoreFiles(Changes);
  if (Kept) {
    Kept->Keep(CHANGES);
  }

  if (Options.Mode == OutputMode::TEXT || Options.Mode == OutputMode::SUMMARY) {
    printf("%s (%s)\n", Name(Info.strToolVersion).c_str(), Name(Tool.File()).c_str());
  }
  Report Report(Changes, Options.Mode, !Options.strCaps.empty());
  bool blDoubt = false;
  for (const ChangedTable& Table : ReadTables(Changes)) {
    Report.Table(Table);
    blDoubt = blDoubt || Table.blDoubt;
  }
  Statement Files(Changes, "SELECT name FROM file ORDER BY name");
  while (Files.Step()) {
    Report.File(Files.Text(0), Diff(Files.Text(0)));
  }
  const bool blShown = Options.Mode == OutputMode::TEXT || Options.Mode == OutputMode::JSON;
  ReportFailures(Run.Failures, blShown, &Report);
  Report.Summary(Run.Status);
  return Options.Mode == OutputMode::CHECK ? CheckStatus(Report, blDoubt, Run.Status) : Run.Status;
}

// Without a database and without a package directory, every action fails, and says so.
int ListActions(const CommandLine& Options) {
  const UpgradeRun Run =
      Tool(Options.strTool, Options.strOwnDir, TARGET).Upgrade(Options.strVersion);
  for (const FailedAction& Action : Run.Failures) {
    puts(Action.strName.c_str());
  }
  return 0;
}

int Fail(const std::string& strWhat) {
  fflush(stdout);
  fprintf(stderr, "tessel-preview: %s\n", Name(strWhat).c_str());
  return NO_PREVIEW;
}

int Preview(const CommandLine& Options, const std::string& strWorkDir) {
  try {
    fs::current_path(strWorkDir);
    fs::create_directory(TARGET);
    setenv("LC_ALL", "C", 1);  // for the messages of other programs
    const int Status =
        Options.Mode == OutputMode::LIST ? ListActions(Options) : PreviewUpgrade(Options);
    if (fflush(stdout) != 0 || ferror(stdout) != 0) {
      throw SystemFailure("cannot write the output");
    }
    return Status;
  } catch (const SqlFailure& Reason) {
    return Fail(std::string("cannot compare the copies: ") + Reason.what());
  } catch (const std::exception& Reason) {
    return Fail(Reason.what());
  }
}

}  // namespace

int main(int argc, char* argv[]) {
  try {
    const CommandLine Options = ParseOptions(argc, argv);
    if (Options.Status >= 0) {
      return fflush(stdout) == 0 ? Options.Status : Fail("cannot write the output");
    }
    const WorkDirectory WorkDir;
    return Preview(Options, WorkDir.Name());
  } catch (const std::exception& Reason) {
    return Fail(Reason.what());
  }
}

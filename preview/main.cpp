// Runs the tool on a copy of the appliance and shows what it changes there.

#include <fcntl.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <memory>

#include "capfiles.h"
#include "compare.h"
#include "failure.h"
#include "files.h"
#include "options.h"
#include "report.h"
#include "snapshot.h"
#include "supervise.h"
#include "tool.h"
#include "undo.h"

namespace {

constexpr int WOULD_CHANGE = 3;
constexpr int NO_PREVIEW = 2;

// Paths in the work directory, which is the current directory.
constexpr const char* BEFORE_DATABASE = "before.db";
constexpr const char* AFTER_DATABASE = "target/system.db";
constexpr const char* BEFORE_CAPS = "before";
constexpr const char* AFTER_CAPS = "after";
constexpr const char* UNDO_SQL = "undo.sql";
constexpr const char* UNDO_PATCH = "undo.patch";

// Passes each change on to several sinks.
class FanOut : public ChangeSink {
 public:
  void Add(ChangeSink* pSink) { m_Sinks.push_back(pSink); }
  void Cell(const TableRow& Before, const TableRow& After, size_t Column) override {
    for (ChangeSink* pSink : m_Sinks) {
      pSink->Cell(Before, After, Column);
    }
  }
  void Added(const TableRow& After) override {
    for (ChangeSink* pSink : m_Sinks) {
      pSink->Added(After);
    }
  }
  void Removed(const TableRow& Before) override {
    for (ChangeSink* pSink : m_Sinks) {
      pSink->Removed(Before);
    }
  }
  void NotCompared(const std::string& strTable, const std::string& strWhat) override {
    for (ChangeSink* pSink : m_Sinks) {
      pSink->NotCompared(strTable, strWhat);
    }
  }

 private:
  std::vector<ChangeSink*> m_Sinks;
};

bool HasColour() {
  const char* szNoColour = getenv("NO_COLOR");
  return isatty(STDOUT_FILENO) == 1 && (szNoColour == nullptr || *szNoColour == '\0');
}

// Returns null for --check, which prints nothing.
std::unique_ptr<Report> MakeReport(OutputMode Mode) {
  switch (Mode) {
    case OutputMode::TEXT:
      return std::make_unique<TextReport>(HasColour());
    case OutputMode::SUMMARY:
      return std::make_unique<SummaryReport>();
    case OutputMode::JSON:
      return std::make_unique<JsonReport>();
    default:
      return nullptr;
  }
}

// --- Steps of a preview ---

// Reading lets SQLite roll back the journal, or apply the log, that a crash of the recorder left.
void Recover(const std::string& strCopy) {
  Database(strCopy, SQLITE_OPEN_READWRITE).Execute("SELECT count(*) FROM sqlite_schema");
}

void CopyAppliance(const CommandLine& Options, const Tool& Tool) {
  CopyDatabase(Options.strDatabase, BEFORE_DATABASE);
  Recover(BEFORE_DATABASE);
  const Descriptor Before(OpenFile(BEFORE_DATABASE, O_RDONLY));
  CopyTo(Before.Get(), BEFORE_DATABASE, AFTER_DATABASE, 0600);
  std::filesystem::create_directory(BEFORE_CAPS);
  std::filesystem::create_directory_symlink(Tool.CapDir(), AFTER_CAPS);
  if (!Options.strCaps.empty()) {
    CopyCapFiles(Options.strCaps, BEFORE_CAPS);
    CopyCapFiles(BEFORE_CAPS, AFTER_CAPS);
  }
}

void CompareDatabases(Report* pReport, Tally* pTally, UndoScript* pUndo) {
  FanOut Sinks;
  Sinks.Add(pTally);
  if (pReport != nullptr) {
    Sinks.Add(pReport);
  }
  if (pUndo != nullptr) {
    Sinks.Add(pUndo);
  }
  Database Db(BEFORE_DATABASE, SQLITE_OPEN_READWRITE);
  Db.Execute(std::string("ATTACH '") + AFTER_DATABASE + "' AS after");
  Compare(Db, &Sinks, pUndo);
}

void CompareCapFiles(Report* pReport, Tally* pTally, bool blUndo) {
  std::string strPatch;
  pTally->m_Files = 0;
  for (const std::string& strName : ChangedFiles(BEFORE_CAPS, AFTER_CAPS)) {
    const std::string strBefore = BEFORE_CAPS + ("/" + strName);
    const std::string strAfter = AFTER_CAPS + ("/" + strName);
    ++pTally->m_Files;
    if (pReport != nullptr) {
      const std::vector<std::string> Labels = {"--label=" + strBefore, "--label=" + strAfter};
      pReport->File(strName, Diff(Labels, strBefore, strAfter));
    }
    if (blUndo) {
      strPatch += Diff({}, strAfter, strBefore);
    }
  }
  if (blUndo) {
    WriteFile(UNDO_PATCH, strPatch);
  }
}

void ReportFailures(const UpgradeRun& Upgrade, Report* pReport, Tally* pTally) {
  pTally->m_Status = Upgrade.Status;
  for (const FailedAction& Failed : Upgrade.Failures) {
    pTally->m_Failed += Failed.blFile ? 0 : 1;
    if (pReport != nullptr) {
      pReport->Failed(Failed);
    }
  }
}

int ListActions(const CommandLine& Options) {
  // There is no database here, so every action fails and the log names it.
  const UpgradeRun Upgrade =
      Tool(Options.strTool, Options.strOwnProgram, "target").Upgrade(Options.strVersion);
  for (const FailedAction& Action : Upgrade.Failures) {
    puts(Action.strName.c_str());
  }
  if (Upgrade.CapActions > 0) {
    printf("%d capability-file actions, which log no names\n", Upgrade.CapActions);
  }
  return 0;
}

int PreviewUpgrade(const CommandLine& Options) {
  const Tool Tool(Options.strTool, Options.strOwnProgram, "target");
  const std::unique_ptr<Report> pReport = MakeReport(Options.Mode);
  std::unique_ptr<UndoDirectory> pUndoDirectory;
  std::unique_ptr<UndoScript> pUndo;
  if (!Options.strUndoDir.empty()) {
    pUndoDirectory = std::make_unique<UndoDirectory>(Options.strUndoDir);
    pUndo = std::make_unique<UndoScript>(UNDO_SQL, Options.strVersion);
  }
  CopyAppliance(Options, Tool);
  if (Options.Mode == OutputMode::TEXT || Options.Mode == OutputMode::SUMMARY) {
    puts(Tool.Describe().c_str());
  }
  const UpgradeRun Upgrade = Tool.Upgrade(Options.strVersion);
  Tally Tally;
  CompareDatabases(pReport.get(), &Tally, pUndo.get());
  if (!Options.strCaps.empty()) {
    CompareCapFiles(pReport.get(), &Tally, pUndo != nullptr);
  } else if (pUndo != nullptr) {
    WriteFile(UNDO_PATCH, "");
  }
  ReportFailures(Upgrade, pReport.get(), &Tally);
  if (pReport != nullptr) {
    pReport->Summary(Tally);
  }
  if (pUndo != nullptr) {
    pUndo->Close();
    pUndoDirectory->Deliver(UNDO_SQL, "system.db.sql");
    pUndoDirectory->Deliver(UNDO_PATCH, "KICapInfo.patch");
  }
  return Options.Mode == OutputMode::CHECK && !Tally.IsEmpty() ? WOULD_CHANGE : Upgrade.Status;
}

// --- Failures ---

// Returns the first error that SQLite's own check finds in the copy of the database.
std::string FirstDamage() {
  try {
    const Database Db(BEFORE_DATABASE, SQLITE_OPEN_READWRITE);
    Statement Check(Db, "PRAGMA integrity_check(1)");
    std::string strDamage = Check.Step() ? Check.Text(0) : "";
    if (strDamage.compare(0, 3, "***") == 0) {  // the first line names the database
      strDamage = strDamage.substr(strDamage.find('\n') + 1);
    }
    return strDamage.substr(0, strDamage.find('\n'));
  } catch (const Failure& Reason) {
    return Reason.what();
  }
}

int Fail(const std::string& strWhat) {
  fflush(stdout);
  fprintf(stderr, "tessel-preview: %s\n", strWhat.c_str());
  return NO_PREVIEW;
}

int FailDatabase(const CommandLine& Options, const SqlFailure& Reason) {
  if (Reason.Code() == SQLITE_CORRUPT || Reason.Code() == SQLITE_NOTADB) {
    return Fail(Options.strDatabase + " is damaged: " + FirstDamage());
  }
  return Fail(Options.strDatabase + ": " + Reason.what());
}

int Preview(const CommandLine& Options, const std::string& strWorkDir) {
  try {
    std::filesystem::current_path(strWorkDir);
    std::filesystem::create_directory("target");
    setenv("LC_ALL", "C", 1);  // for the messages of other programs
    const int Status =
        Options.Mode == OutputMode::LIST ? ListActions(Options) : PreviewUpgrade(Options);
    if (fflush(stdout) != 0 || ferror(stdout) != 0) {
      throw SystemFailure("cannot write the output");
    }
    return Status;
  } catch (const SqlFailure& Reason) {
    return FailDatabase(Options, Reason);
  } catch (const std::exception& Reason) {
    return Fail(Reason.what());
  }
}

}  // namespace

int main(int argc, char* argv[]) {
  try {
    const CommandLine Options = ParseOptions(argc, argv);
    if (Options.blDone) {
      return fflush(stdout) == 0 ? 0 : Fail("cannot write the output");
    }
    return RunSupervised(
        [&](const std::string& strWorkDir) { return Preview(Options, strWorkDir); });
  } catch (const std::exception& Reason) {
    return Fail(Reason.what());
  }
}

#include "options.h"

#include <getopt.h>

#include <algorithm>
#include <cctype>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <limits>

#include "failure.h"
#include "files.h"

namespace {

constexpr const char* DEFAULT_DATABASE = "/var/packages/Camveld/target/system.db";

constexpr const char* HELP =
    "Usage: tessel-preview [OPTION]... [DATABASE] VERSION\n"
    "Shows what tesselupgrader would change when it replaces a package of version VERSION.\n"
    "DATABASE, by default the appliance's own, and the capability files stay as they are.\n"
    "\n"
    "  --summary    print the counts alone\n"
    "  --json       print an object a change, each on a line\n"
    "  --list       name the actions that would run\n"
    "  --check      print nothing; status 3 when something would change\n"
    "  --undo DIR   write to DIR what takes the upgrade back\n"
    "  --caps DIR   the capability files, by default @camveld/@KICapInfo beside DATABASE\n"
    "  --tool FILE  the tesselupgrader to run, by default the newest of those at hand\n"
    "  --help       print this\n"
    "  --version    print the version\n"
    "\n"
    "Status: the tool's (0, 255), 3 from --check, 2 when no preview could be made.\n";

enum OptionCode { CAPS = 1, HELP_TEXT, PROGRAM_VERSION, TOOL, UNDO, FIRST_MODE };

constexpr option OPTION_LIST[] = {
    {"caps", required_argument, nullptr, CAPS},
    {"help", no_argument, nullptr, HELP_TEXT},
    {"version", no_argument, nullptr, PROGRAM_VERSION},
    {"tool", required_argument, nullptr, TOOL},
    {"undo", required_argument, nullptr, UNDO},
    {"summary", no_argument, nullptr, FIRST_MODE + static_cast<int>(OutputMode::SUMMARY)},
    {"json", no_argument, nullptr, FIRST_MODE + static_cast<int>(OutputMode::JSON)},
    {"list", no_argument, nullptr, FIRST_MODE + static_cast<int>(OutputMode::LIST)},
    {"check", no_argument, nullptr, FIRST_MODE + static_cast<int>(OutputMode::CHECK)},
    {nullptr, 0, nullptr, 0},
};

bool IsNumber(const std::string& strText) {
  return !strText.empty() && std::all_of(strText.begin(), strText.end(),
                                         [](unsigned char Char) { return isdigit(Char) != 0; });
}

void CheckVersion(const std::string& strVersion) {
  const std::string strNumber = strVersion.substr(strVersion.rfind('-') + 1);
  if (!IsNumber(strVersion)) {
    const bool blPackage = IsNumber(strNumber) && strVersion.size() > strNumber.size() + 1;
    throw Failure("not a version number: " + strVersion +
                  (blPackage ? " (give the number behind the dash: " + strNumber + ")" : ""));
  }
  const std::string strDigits =
      strVersion.substr(std::min(strVersion.find_first_not_of('0'), strVersion.size() - 1));
  if (strDigits.size() > 10 ||
      strtoull(strDigits.c_str(), nullptr, 10) > std::numeric_limits<uint32_t>::max()) {
    throw Failure("version " + strVersion + " is beyond 32 bits");
  }
}

void SetMode(OutputMode Mode, OutputMode* pMode) {
  if (*pMode != OutputMode::TEXT && *pMode != Mode) {
    throw Failure("only one of --summary, --json, --list and --check can be given");
  }
  *pMode = Mode;
}

void SetFile(const char* szName, const char* szValue, std::string* pFile) {
  if (*szValue == '\0') {
    throw Failure(std::string("option '--") + szName + "' needs a name");
  }
  *pFile = szValue;
}

void Print(CommandLine* pOptions, const char* szText) {
  fputs(szText, stdout);
  pOptions->blDone = true;
}

// By default, compares the capability files beside the database, if there are any.
void FindCaps(CommandLine* pOptions) {
  const bool blBeside = pOptions->strCaps.empty();
  if (blBeside) {
    pOptions->strCaps =
        std::filesystem::path(pOptions->strDatabase).parent_path() / "@camveld/@KICapInfo";
  }
  if (!IsDirectory(pOptions->strCaps)) {
    if (!blBeside) {
      throw Failure("no such directory: " + pOptions->strCaps);
    }
    pOptions->strCaps.clear();
  }
}

// Makes all paths absolute, because a preview changes to a directory of its own.
void CompleteNames(CommandLine* pOptions) {
  for (std::string* pFile :
       {&pOptions->strDatabase, &pOptions->strCaps, &pOptions->strTool, &pOptions->strUndoDir}) {
    if (!pFile->empty()) {
      *pFile = std::filesystem::absolute(*pFile).lexically_normal();
      if (pFile->size() > 1 && pFile->back() == '/') {
        pFile->pop_back();
      }
    }
  }
}

void SetPositional(int Count, char* szArguments[], CommandLine* pOptions) {
  if (Count < 1 || Count > 2) {
    throw Failure(Count < 1 ? "VERSION is missing (--help says more)"
                            : std::string("too many arguments, from ") + szArguments[2] + " on");
  }
  pOptions->strDatabase = Count == 2 ? szArguments[0] : DEFAULT_DATABASE;
  pOptions->strVersion = szArguments[Count - 1];
  CheckVersion(pOptions->strVersion);
}

}  // namespace

CommandLine ParseOptions(int argc, char* argv[]) {
  CommandLine Options;
  int Option;
  int Index = 0;
  opterr = 0;
  while ((Option = getopt_long(argc, argv, "", OPTION_LIST, &Index)) != -1) {
    switch (Option) {
      case HELP_TEXT:
        Print(&Options, HELP);
        return Options;
      case PROGRAM_VERSION:
        Print(&Options, "tessel-preview " TESSEL_VERSION "\n");
        return Options;
      case CAPS:
        SetFile("caps", optarg, &Options.strCaps);
        break;
      case TOOL:
        SetFile("tool", optarg, &Options.strTool);
        break;
      case UNDO:
        SetFile("undo", optarg, &Options.strUndoDir);
        break;
      case '?':
        throw Failure(std::string("unknown, ambiguous or incomplete option: ") + argv[optind - 1] +
                      " (--help says more)");
      default:
        SetMode(static_cast<OutputMode>(Option - FIRST_MODE), &Options.Mode);
        break;
    }
  }
  if (Options.Mode == OutputMode::LIST && !Options.strUndoDir.empty()) {
    throw Failure("--list changes nothing that --undo could take back");
  }
  SetPositional(argc - optind, argv + optind, &Options);
  CompleteNames(&Options);
  Options.strOwnProgram = std::filesystem::read_symlink("/proc/self/exe");
  FindCaps(&Options);
  return Options;
}

#include "options.h"

#include <getopt.h>
#include <sys/stat.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <limits>

#include "failure.h"

namespace fs = std::filesystem;

namespace {

constexpr const char* DEFAULT_DATABASE = "/var/packages/Camveld/target/system.db";
constexpr int MISUSED = 2;

constexpr const char* HELP =
    "Usage: tessel-preview [OPTION]... [DATABASE] VERSION\n"
    "Shows what tesselupgrader would change when it replaces a package of version VERSION.\n"
    "DATABASE, by default the appliance's own, and the capability files stay as they are.\n"
    "\n"
    "      --summary    print the counts alone\n"
    "      --json       print an object a change, each on a line\n"
    "      --list       name the actions that would run\n"
    "      --check      print nothing; status 3 when something would change\n"
    "      --undo FILE  keep the changes in FILE, for tessel-undo\n"
    "      --caps DIR   the capability files, by default @camveld/@KICapInfo beside DATABASE\n"
    "      --tool FILE  the tesselupgrader to run, by default the one beside this program\n"
    "  -h, --help       print this\n"
    "  -V, --version    print the version\n"
    "\n"
    "Status: the tool's (0, 255), 3 from --check, 2 when no preview could be made.\n";

enum OptionCode { CAPS = 1, TOOL, UNDO, FIRST_MODE };

constexpr option OPTION_LIST[] = {
    {"caps", required_argument, nullptr, CAPS},
    {"tool", required_argument, nullptr, TOOL},
    {"undo", required_argument, nullptr, UNDO},
    {"summary", no_argument, nullptr, FIRST_MODE + static_cast<int>(OutputMode::SUMMARY)},
    {"json", no_argument, nullptr, FIRST_MODE + static_cast<int>(OutputMode::JSON)},
    {"list", no_argument, nullptr, FIRST_MODE + static_cast<int>(OutputMode::LIST)},
    {"check", no_argument, nullptr, FIRST_MODE + static_cast<int>(OutputMode::CHECK)},
    {"help", no_argument, nullptr, 'h'},
    {"version", no_argument, nullptr, 'V'},
    {nullptr, 0, nullptr, 0},
};

bool IsNumber(const std::string& strText) {
  return !strText.empty() && strText.find_first_not_of("0123456789") == std::string::npos;
}

void CheckVersion(const std::string& strVersion) {
  const std::string strNumber = strVersion.substr(strVersion.rfind('-') + 1);
  if (!IsNumber(strVersion)) {
    const bool blPackage = IsNumber(strNumber) && strVersion.size() > strNumber.size() + 1;
    throw Failure("not a version number: '" + strVersion + "'" +
                  (blPackage ? " (give the number after the last hyphen: " + strNumber + ")" : ""));
  }
  // A number beyond 64 bits gives the highest one.
  if (strtoull(strVersion.c_str(), nullptr, 10) > std::numeric_limits<uint32_t>::max()) {
    throw Failure("version " + strVersion + " is beyond 32 bits");
  }
}

void SetMode(OutputMode Mode, OutputMode* pMode) {
  if (*pMode != OutputMode::TEXT && *pMode != Mode) {
    throw Failure("only one of --summary, --json, --list and --check can be given");
  }
  *pMode = Mode;
}

void SetPath(const char* szOption, std::string* pPath) {
  if (*optarg == '\0') {
    throw Failure(std::string("option '--") + szOption + "' needs a name");
  }
  *pPath = fs::absolute(optarg);
}

std::string Resolved(const std::string& strFile) {
  std::error_code Error;
  const fs::path Path = fs::canonical(strFile, Error);
  if (Error) {
    throw Failure("cannot open " + strFile + ": " + Error.message());
  }
  return Path;
}

// By default, the capability files are beside the database as it was named, if there are any.
void FindCaps(CommandLine* pOptions) {
  const fs::path Beside = fs::path(pOptions->strDatabase).parent_path() / "@camveld/@KICapInfo";
  if (!pOptions->strCaps.empty()) {
    pOptions->strCaps = Resolved(pOptions->strCaps);
    if (!fs::is_directory(pOptions->strCaps)) {
      throw Failure(pOptions->strCaps + " is not a directory");
    }
  } else if (std::error_code Error; fs::is_directory(Beside, Error)) {
    pOptions->strCaps = Resolved(Beside);
  }
}

void SetArguments(int Count, char* szArguments[], CommandLine* pOptions) {
  if (Count < 1 || Count > 2) {
    throw Failure(Count < 1 ? "VERSION is missing (--help says more)"
                            : std::string("too many arguments, from ") + szArguments[2] + " on");
  }
  pOptions->strVersion = szArguments[Count - 1];
  CheckVersion(pOptions->strVersion);
  if (pOptions->Mode != OutputMode::LIST) {
    pOptions->strDatabase = fs::absolute(Count == 2 ? szArguments[0] : DEFAULT_DATABASE);
    FindCaps(pOptions);
    pOptions->strDatabase = Resolved(pOptions->strDatabase);
    if (!fs::is_regular_file(pOptions->strDatabase)) {
      throw Failure(pOptions->strDatabase + " is not a regular file");
    }
  } else if (Count == 2 || !pOptions->strUndo.empty() || !pOptions->strCaps.empty()) {
    throw Failure("--list looks at no database and no file");
  }
}

}  // namespace

CommandLine ParseOptions(int argc, char* argv[]) {
  CommandLine Options;
  for (int Option; (Option = getopt_long(argc, argv, "hV", OPTION_LIST, nullptr)) != -1;) {
    switch (Option) {
      case 'h':
      case 'V':
        fputs(Option == 'h' ? HELP : "tessel-preview " TESSEL_VERSION "\n", stdout);
        Options.Status = 0;
        return Options;
      case CAPS:
        SetPath("caps", &Options.strCaps);
        break;
      case TOOL:
        SetPath("tool", &Options.strTool);
        break;
      case UNDO:
        SetPath("undo", &Options.strUndo);
        break;
      case '?':  // getopt_long has printed the reason
        Options.Status = MISUSED;
        return Options;
      default:
        SetMode(static_cast<OutputMode>(Option - FIRST_MODE), &Options.Mode);
        break;
    }
  }
  SetArguments(argc - optind, argv + optind, &Options);
  Options.strOwnDir = fs::read_symlink("/proc/self/exe").parent_path();
  return Options;
}

#include "tool.h"

#include <sys/inotify.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <climits>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "command.h"
#include "failure.h"
#include "files.h"

namespace {

constexpr int FAILED_STATUS = 255;

std::string FirstLine(const std::string& strText) { return strText.substr(0, strText.find('\n')); }

// --- Where the programs are ---

// Looks in libexec, for an installed program, and in tools/, for one in build/PRESET.
std::string FindHelper(const std::string& strOwnDir) {
  for (const char* szPlace : {"/../libexec/tesselupgrader/", "/../../../tools/"}) {
    std::string strHelper = strOwnDir + szPlace + "private-appliance";
    if (Exists(strHelper)) {
      return strHelper;
    }
  }
  throw Failure("private-appliance is not installed in " + strOwnDir +
                "/../libexec/tesselupgrader");
}

// Returns the bytes of an ELF header that identify the processor; "" for a script.
std::string Processor(const std::string& strProgram) {
  char rgHead[20] = "";
  std::ifstream(strProgram, std::ios::binary).read(rgHead, sizeof(rgHead));
  const std::string strHead(rgHead, sizeof(rgHead));
  return strHead.compare(0, 4, "\177ELF") == 0 ? strHead.substr(4, 1) + strHead.substr(18) : "";
}

bool IsRunnable(const std::string& strTool, const std::string& strOwnProgram) {
  const std::string strProcessor = Processor(strTool);
  return access(strTool.c_str(), X_OK) == 0 && !IsDirectory(strTool) &&
         (strProcessor.empty() || strProcessor == Processor(strOwnProgram));
}

std::string FindTool(const std::string& strOwnProgram, const std::string& strOwnDir) {
  std::vector<std::string> Tools = {strOwnDir + "/tesselupgrader"};
  if (Exists(strOwnDir + "/../../../tools/private-appliance")) {
    const std::string strBuild = strOwnDir + "/../../";
    for (const std::string& strTree : ListDirectory(strBuild)) {
      Tools.push_back(strBuild + strTree + "/main/tesselupgrader");
    }
  }
  std::string strNewest;
  std::filesystem::file_time_type Newest;
  for (const std::string& strTool : Tools) {
    if (IsRunnable(strTool, strOwnProgram)) {
      const auto Time = std::filesystem::last_write_time(strTool);
      if (strNewest.empty() || Time > Newest) {
        strNewest = strTool;
        Newest = Time;
      }
    }
  }
  if (strNewest.empty()) {
    throw Failure("no tesselupgrader is installed beside this program (--tool names another)");
  }
  return strNewest;
}

// --- What a run tells ---

// Makes the datagram socket that receives the tool's syslog messages.
int BindSyslog(const std::string& strName) {
  sockaddr_un Address = {};
  Address.sun_family = AF_UNIX;
  if (strName.size() >= sizeof(Address.sun_path)) {
    throw Failure("the name of the temporary directory is too long: " + strName);
  }
  strName.copy(Address.sun_path, strName.size());
  unlink(strName.c_str());
  const int Fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  if (Fd == -1 || bind(Fd, reinterpret_cast<sockaddr*>(&Address), sizeof(Address)) != 0) {
    throw SystemFailure("cannot make a socket " + strName);
  }
  return Fd;
}

// Watches closings, too: otherwise the kernel merges openings that follow each other.
int WatchOpenings(const std::string& strDir) {
  const int Fd = inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
  if (Fd == -1 || inotify_add_watch(Fd, strDir.c_str(), IN_OPEN | IN_CLOSE) == -1) {
    throw SystemFailure("cannot watch " + strDir);
  }
  return Fd;
}

// Counts openings of the directory itself: their events have no name.
int CountOpenings(int Fd) {
  alignas(inotify_event) char rgBuf[65536];
  int Count = 0;
  ssize_t Len;
  while ((Len = read(Fd, rgBuf, sizeof(rgBuf))) > 0) {
    for (ssize_t Pos = 0; Pos < Len;) {
      const auto* pEvent = reinterpret_cast<const inotify_event*>(&rgBuf[Pos]);
      Count += pEvent->len == 0 && (pEvent->mask & IN_OPEN) != 0 ? 1 : 0;
      Pos += static_cast<ssize_t>(sizeof(inotify_event) + pEvent->len);
    }
  }
  return Count;
}

// Returns the text before the first szEnd, back to the last szBegin; "" if one is missing.
std::string Between(const std::string& strText, const char* szBegin, const char* szEnd) {
  const size_t End = strText.find(szEnd);
  const size_t Begin = End == std::string::npos ? End : strText.rfind(szBegin, End);
  if (Begin == std::string::npos) {
    return "";
  }
  const size_t Start = Begin + strlen(szBegin);
  return strText.substr(Start, End - Start);
}

// The part of a record before the first ": ", which is removed from it; "" if there is none.
std::string TakePart(std::string* pRecord) {
  const size_t End = pRecord->find(": ");
  if (End == std::string::npos) {
    return "";
  }
  const std::string strPart = pRecord->substr(0, End);
  pRecord->erase(0, End + 2);
  return strPart;
}

// The log names the failed actions on the database. Syslog has name and reason of each failure; an
// action on capability files also names the file.
std::vector<FailedAction> FailedActions(const std::string& strLog,
                                        const std::vector<std::string>& Records) {
  std::vector<FailedAction> Failures;
  std::istringstream Log(strLog);
  for (std::string strLine; std::getline(Log, strLine);) {
    const std::string strName = Between(strLine, ":", "(): KiDBExecute command (");
    if (!strName.empty()) {
      Failures.push_back({strName, "the reason is unknown", false});
    }
  }
  for (std::string strReason : Records) {
    TakePart(&strReason);  // time and program
    const std::string strName = TakePart(&strReason);
    bool blDatabase = false;
    for (FailedAction& Failure : Failures) {
      if (!Failure.blFile && Failure.strName == strName) {
        Failure.strReason = strReason.substr(0, strReason.find(" (extended code "));
        blDatabase = true;
      }
    }
    // Records of the log writer begin with a source file.
    if (!blDatabase && !strName.empty() && strName.find('.') == std::string::npos) {
      const std::string strFile = TakePart(&strReason);
      Failures.push_back(
          {"capability file " + strFile.substr(strFile.rfind('/') + 1), strReason, true});
    }
  }
  return Failures;
}

}  // namespace

Tool::Tool(const std::string& strTool, const std::string& strOwnProgram,
           const std::string& strTarget)
    : m_strTool(strTool), m_strTarget(strTarget) {
  const std::string strOwnDir = std::filesystem::path(strOwnProgram).parent_path();
  m_strHelper = FindHelper(strOwnDir);
  if (m_strTool.empty()) {
    m_strTool = FindTool(strOwnProgram, strOwnDir);
  }
  if (access(m_strTool.c_str(), X_OK) != 0) {
    throw SystemFailure("cannot run " + m_strTool);
  }
  m_strTool = std::filesystem::canonical(m_strTool);
  std::filesystem::create_directories(CapDir());
}

// Without arguments, the tool prints its name and version, then its usage.
std::string Tool::Describe() const {
  const CommandResult Result = RunCommand({m_strHelper, m_strTarget, m_strTool});
  if (Result.Status != 1) {
    throw Failure("cannot run " + m_strTool + ": " + FirstLine(Result.strOutput));
  }
  return FirstLine(Result.strOutput) + " (" + m_strTool + ")";
}

UpgradeRun Tool::Upgrade(const std::string& strVersion) const {
  const Descriptor Syslog(BindSyslog(m_strTarget + "/syslog"));
  const Descriptor Openings(WatchOpenings(CapDir()));
  const CommandResult Result =
      RunCommand({m_strHelper, m_strTarget, m_strTool, strVersion}, Syslog.Get());
  if (Result.Status != 0 && Result.Status != FAILED_STATUS) {
    throw Failure("cannot run " + m_strTool + ": " +
                  (Result.Status > 128
                       ? "it was ended by " + std::string(strsignal(Result.Status - 128))
                       : FirstLine(Result.strOutput)));
  }
  UpgradeRun Upgrade;
  Upgrade.Status = Result.Status;
  const std::string strLog = m_strTarget + "/log/camveld.log";
  Upgrade.Failures = FailedActions(Exists(strLog) ? ReadWholeFile(strLog) : "", Result.Records);
  Upgrade.CapActions = CountOpenings(Openings.Get());
  return Upgrade;
}

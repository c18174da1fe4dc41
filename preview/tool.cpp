#include "tool.h"

#include <sqlite3.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <initializer_list>
#include <string_view>

#include "copy.h"
#include "failure.h"
#include "fileops.h"
#include "process.h"

namespace {

constexpr int USAGE_STATUS = 1;
constexpr int FAILED_STATUS = 255;

std::string FirstLine(const std::string& strText) { return strText.substr(0, strText.find('\n')); }

std::string Runnable(const std::string& strFile) {
  if (access(strFile.c_str(), X_OK) != 0) {
    throw SystemFailure("cannot run " + strFile);
  }
  return std::filesystem::canonical(strFile);
}

// Makes the datagram socket that receives the tool's syslog records.
int BindSyslog(const std::string& strName) {
  sockaddr_un Address = {};
  Address.sun_family = AF_UNIX;
  strName.copy(Address.sun_path, sizeof(Address.sun_path) - 1);
  unlink(strName.c_str());
  const int Fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  if (Fd == -1 || bind(Fd, reinterpret_cast<sockaddr*>(&Address), sizeof(Address)) != 0) {
    throw SystemFailure("cannot make a socket " + strName);
  }
  return Fd;
}

// A record is "<PRIORITY>MONTH DAY TIME PROGRAM: ACTION: REASON", where a reason of SQLite ends in
// its code. Adds the record if it has an action.
void AddFailure(const std::string& strRecord, std::vector<FailedAction>* pFailures) {
  char szName[128];
  int Reason = 0;
  sscanf(strRecord.c_str(), "<%*d>%*16c%*[^:]: %127[A-Za-z0-9_]: %n", szName, &Reason);
  if (Reason == 0) {
    return;
  }
  FailedAction Failed;
  Failed.strName = szName;
  Failed.strReason = strRecord.substr(static_cast<size_t>(Reason));
  constexpr std::string_view Mark = " (extended code ";
  const size_t Code = Failed.strReason.rfind(Mark);
  if (Code != std::string::npos) {
    Failed.Code = static_cast<int>(strtol(&Failed.strReason[Code + Mark.size()], nullptr, 10));
    Failed.strReason.erase(Code);
  }
  pFailures->push_back(Failed);
}

// Returns the text of a failed database action from the tool's log. Only the tool's own lines have
// its process id: a value in a text cannot know it, and so cannot forge a line.
std::string FailedText(const std::string& strLog, pid_t Pid, const std::string& strAction) {
  const std::string strOwn = " [" + std::to_string(Pid) + "] ";
  const std::string strBegin = ":" + strAction + "(): KiDBExecute command (";
  for (size_t Line = strLog.find(strOwn); Line != std::string::npos;) {
    const size_t Next = strLog.find(strOwn, Line + 1);
    const std::string strLine = strLog.substr(Line, Next - Line);
    const size_t Begin = strLine.find(strBegin);
    if (Begin != std::string::npos && Begin < strLine.find(' ', strOwn.size())) {
      const size_t Text = Begin + strBegin.size();
      return strLine.substr(Text, strLine.rfind(") error.\n") - Text);
    }
    Line = Next;
  }
  return "";
}

// True if the copy has failed, and not what it is a copy of: no memory, an I/O error, no room.
bool IsOfTheCopy(const FailedAction& Failed) {
  if (Failed.Code != 0) {
    const int Code = Failed.Code & 0xff;
    return Code == SQLITE_NOMEM || Code == SQLITE_IOERR || Code == SQLITE_FULL;
  }
  // "FILE: STEP: REASON", perhaps with what follows from it after a semicolon.
  const std::string strCause = Failed.strReason.substr(0, Failed.strReason.find("; "));
  const size_t Colon = strCause.rfind(": ");
  const std::string strSystem = strCause.substr(Colon == std::string::npos ? 0 : Colon + 2);
  const std::initializer_list<int> Errors = {ENOMEM, EIO, ENOSPC, EDQUOT, EMFILE, ENFILE};
  return std::any_of(Errors.begin(), Errors.end(),
                     [&strSystem](int Errno) { return strSystem == strerror(Errno); });
}

}  // namespace

Tool::Tool(const std::string& strTool, const std::string& strOwnDir, const std::string& strTarget)
    : m_strTool(Runnable(strTool.empty() ? strOwnDir + "/tesselupgrader" : strTool)),
      m_strTarget(strTarget),
      m_strHelper(Runnable(strOwnDir + "/../libexec/tesselupgrader/private-appliance")) {}

std::vector<std::string> Tool::Command() const {
  return {m_strHelper, "--read-only", m_strTarget, m_strTool};
}

std::string Tool::Banner() const {
  // Without arguments, the tool prints its name and version, then its usage.
  const CommandResult Result = RunCommand(Command());
  if (Result.Status != USAGE_STATUS) {
    throw Failure("cannot run " + m_strTool + ": " + FirstLine(Result.strOutput));
  }
  return FirstLine(Result.strOutput);
}

UpgradeRun Tool::Upgrade(const std::string& strVersion) const {
  const fileops::Descriptor Syslog(BindSyslog(m_strTarget + "/syslog"));
  std::vector<std::string> Arguments = Command();
  Arguments.push_back(strVersion);
  const CommandResult Result = RunCommand(Arguments, Syslog.Get());
  if (Result.Status != 0 && Result.Status != FAILED_STATUS) {
    throw Failure("cannot run " + m_strTool + ": " +
                  (Result.Status > 128
                       ? "it was ended by " + std::string(strsignal(Result.Status - 128))
                       : FirstLine(Result.strOutput)));
  }
  UpgradeRun Upgrade;
  Upgrade.Status = Result.Status;
  for (const std::string& strRecord : Result.Records) {
    AddFailure(strRecord, &Upgrade.Failures);
  }
  const std::string strLogFile = m_strTarget + "/log/camveld.log";
  const std::string strLog = std::filesystem::exists(strLogFile) ? ReadFile(strLogFile) : "";
  for (FailedAction& Failed : Upgrade.Failures) {
    Failed.strSqlCmd = FailedText(strLog, Result.Pid, Failed.strName);
    if (IsOfTheCopy(Failed)) {
      throw Failure("the copy cannot be upgraded: " + Failed.strName + ": " + Failed.strReason);
    }
  }
  return Upgrade;
}

// Runs the unmodified tesselupgrader on a copy of the appliance.
#pragma once

#include <string>
#include <vector>

struct FailedAction {
  std::string strName;
  std::string strReason;
  int Code = 0;           // SQLite's result code; 0 if the reason is not SQLite's
  std::string strSqlCmd;  // the text that failed; empty if there is none
};

struct UpgradeRun {
  int Status = 0;                      // 0 or 255
  std::vector<FailedAction> Failures;  // in the order in which they happened
};

// The tool, and the directory that it upgrades: TARGET/system.db and TARGET/@camveld/@KICapInfo,
// with a log and a syslog of their own. The tool can write nothing else. All functions throw
// Failure.
class Tool {
 public:
  // Uses strTool or, if that is empty, the tool in strOwnDir, the directory of this program.
  // strTarget is short, because a socket in it needs a short name.
  Tool(const std::string& strTool, const std::string& strOwnDir, const std::string& strTarget);

  const std::string& File() const { return m_strTool; }

  // What the tool calls itself: "tesselupgrader VERSION".
  std::string Banner() const;

  UpgradeRun Upgrade(const std::string& strVersion) const;

 private:
  std::vector<std::string> Command() const;

  std::string m_strTool;
  const std::string m_strTarget;
  const std::string m_strHelper;  // private-appliance
};

// Runs the unmodified tesselupgrader on a copy of the appliance.
#pragma once

#include <string>
#include <vector>

struct FailedAction {
  std::string strName;  // the action, or "capability file NAME"
  std::string strReason;
  bool blFile;
};

struct UpgradeRun {
  int Status = 0;  // 0 or 255
  std::vector<FailedAction> Failures;
  int CapActions = 0;  // how many actions have read the capability directory
};

// The tool, and the directory that it upgrades: TARGET/system.db and TARGET/@camveld/@KICapInfo,
// with a log and a syslog of their own. All functions throw Failure.
class Tool {
 public:
  // Uses strTool on the existing directory strTarget. If strTool is empty, uses the newest tool for
  // this processor that is installed or built beside this program.
  Tool(const std::string& strTool, const std::string& strOwnProgram, const std::string& strTarget);

  // "tesselupgrader VERSION (FILE)".
  std::string Describe() const;
  UpgradeRun Upgrade(const std::string& strVersion) const;
  std::string CapDir() const { return m_strTarget + "/@camveld/@KICapInfo"; }

 private:
  std::string m_strTool;
  const std::string m_strTarget;
  std::string m_strHelper;  // private-appliance
};

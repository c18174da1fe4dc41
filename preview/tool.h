// tesselupgrader, run unmodified on a copy of the appliance.
#pragma once

#include <string>
#include <vector>

struct FailedAction {
  std::string strName;  // of the action, or "capability file NAME"
  std::string strReason;
  bool blFile;
};

struct UpgradeRun {
  int Status = 0;  // 0 or 255
  std::vector<FailedAction> Failures;
  int CapActions = 0;  // how many actions have looked at the capability directory
};

// An appliance's directory: TARGET/system.db and TARGET/@camveld/@KICapInfo, with a log and a
// syslog of its own. All functions throw Failure.
class Tool {
 public:
  // Runs strTool, or the newest tool of this processor among those installed and built beside this
  // program when it is empty, on the directory strTarget, which must exist.
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

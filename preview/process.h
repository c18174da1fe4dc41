// A directory that is cleaned up, and other programs.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

// A new directory below TMPDIR or /tmp. Another process removes it once this object is gone or this
// process has ended, even by SIGKILL, and all programs that it has started have ended, too. The
// destructor waits for that. Throws Failure.
class WorkDirectory {
 public:
  WorkDirectory();
  ~WorkDirectory();
  WorkDirectory(const WorkDirectory&) = delete;
  WorkDirectory& operator=(const WorkDirectory&) = delete;

  const std::string& Name() const { return m_strName; }  // absolute

 private:
  std::string m_strName;
  pid_t m_Cleaner = -1;
  int m_PipeFd = -1;
};

struct CommandResult {
  pid_t Pid = 0;
  int Status = 0;                    // exit status; 128 + the number of the signal that ended it
  std::string strOutput;             // standard output and standard error
  std::vector<std::string> Records;  // datagrams that arrived while it ran
};

// Runs a program with an empty standard input. Searches PATH if the name has no slash. Meanwhile
// reads datagrams from the socket SyslogFd, unless that is -1. The program dies with this process.
// Throws Failure.
CommandResult RunCommand(const std::vector<std::string>& Arguments, int SyslogFd = -1);

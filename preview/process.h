// Processes: one that is cleaned up after, and other programs.
#pragma once

#include <sys/types.h>

#include <functional>
#include <string>
#include <vector>

// Runs Work in a child process and returns its status. Gives Work the name of a new directory below
// TMPDIR or /tmp. Removes the directory once the child and all its descendants have ended, even
// after a crash. A signal that would end this process first ends the child. Throws Failure.
int RunSupervised(const std::function<int(const std::string& strWorkDir)>& Work);

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

// Runs other programs to their end.
#pragma once

#include <string>
#include <vector>

struct CommandResult {
  int Status = 0;                    // exit status; 128 + the number of the signal that ended it
  std::string strOutput;             // standard output and standard error
  std::vector<std::string> Records;  // datagrams that arrived while it ran
};

// Runs a program with an empty standard input. Searches PATH if the name has no slash. Meanwhile
// reads datagrams from the socket SyslogFd, unless that is -1. The program dies with this process.
// Throws Failure.
CommandResult RunCommand(const std::vector<std::string>& Arguments, int SyslogFd = -1);

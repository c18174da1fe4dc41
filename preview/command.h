// Other programs, run to their end.
#pragma once

#include <string>
#include <vector>

struct CommandResult {
  int Status = 0;                    // exit status; 128 and the signal's number if one ended it
  std::string strOutput;             // of standard output and standard error
  std::vector<std::string> Records;  // the datagrams that came in while it ran
};

// Runs a program, found in PATH unless its name has a slash, with nothing to read. Reads datagrams
// from the socket SyslogFd meanwhile, unless that is -1. The program dies with this process.
// Throws Failure.
CommandResult RunCommand(const std::vector<std::string>& Arguments, int SyslogFd = -1);

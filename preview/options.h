// The command line.
#pragma once

#include <string>

enum class OutputMode { TEXT, SUMMARY, JSON, LIST, CHECK };

struct CommandLine {
  OutputMode Mode = OutputMode::TEXT;
  std::string strDatabase;
  std::string strCaps;  // empty: there are no capability files
  std::string strTool;  // empty: the one beside this program
  std::string strUndo;  // the change file to keep; empty: none
  std::string strVersion;
  std::string strOwnDir;  // the directory of this program
  int Status = -1;        // if not negative: the program is to end with it
};

// Reads the command line. All paths of the result are absolute, and those of existing files lead
// through no link. Throws Failure.
CommandLine ParseOptions(int argc, char* argv[]);

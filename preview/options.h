// The command line.
#pragma once

#include <string>

enum class OutputMode { TEXT, SUMMARY, JSON, LIST, CHECK };

struct CommandLine {
  OutputMode Mode = OutputMode::TEXT;
  std::string strDatabase;
  std::string strCaps;     // empty: the capability files are not looked at
  std::string strTool;     // empty: to be looked for
  std::string strUndoDir;  // empty: no way back is written
  std::string strVersion;
  std::string strOwnProgram;  // the file, which an emulator knows only before the first chdir
  bool blDone = false;        // --help or --version: everything is printed
};

// Reads the command line. Throws Failure.
CommandLine ParseOptions(int argc, char* argv[]);

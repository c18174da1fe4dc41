// The command line.
#pragma once

#include <string>

enum class OutputMode { TEXT, SUMMARY, JSON, LIST, CHECK };

struct CommandLine {
  OutputMode Mode = OutputMode::TEXT;
  std::string strDatabase;
  std::string strCaps;     // empty: do not compare capability files
  std::string strTool;     // empty: search for the tool
  std::string strUndoDir;  // empty: write no way back
  std::string strVersion;
  std::string strOwnProgram;  // found before the first chdir, as an emulator needs
  bool blDone = false;        // --help or --version was printed
};

// Reads the command line. Throws Failure.
CommandLine ParseOptions(int argc, char* argv[]);

// What the test programs stand on: a private /var and /dev/log for the whole program, the shipped
// tool run as an installer would run it, and the files it leaves behind.
#pragma once

#include <gtest/gtest.h>

#include <filesystem>
#include <string>
#include <thread>
#include <vector>

namespace fs = std::filesystem;
using std::string;
using Lines = std::vector<string>;

const string SYSTEM_DB = "/var/packages/Camveld/target/system.db";
const string CAP_DIR = "/var/packages/Camveld/target/@camveld/@KICapInfo";
const string LOG_FILE = "/var/log/camveld/camveld.log";

string ReadFile(const string& strPath);
void WriteFile(const string& strPath, const string& strContent);

// The rows of tests/strName: fields parted by tabs, with \ooo for a byte by its octal value.
std::vector<Lines> ReadTable(const string& strName);

struct RUN {
  int Status;        // exit status, as a shell has it
  string strOutput;  // of both streams
};

// Runs a shell command, a program of the build, or the shipped tool; the last two through strace or
// the like when strWrapper is given.
RUN RunCommand(const string& strCommand);
RUN RunProgram(const string& strProgram, const string& strArgs, const string& strWrapper = "");
inline RUN RunTool(const string& strArgs, const string& strWrapper = "") {
  return RunProgram(TESSEL_TOOL, strArgs, strWrapper);
}

// Runs an SQL text with the sqlite3 shell and returns its rows, columns parted by '|'.
string Sql(const string& strDb, const string& strSqlCmd);

// The lines of the package log, without time, process and thread id and line number.
Lines LogLines();

// Receives what is sent to /dev/log while it lives. Senders wait when ten records are unread.
class SyslogSocket {
 public:
  SyslogSocket();
  ~SyslogSocket();
  // The records since the last call, as "<11> message", without line number.
  Lines Stop();

 private:
  const int m_Fd;
};

// Each test starts with the empty directories of an appliance under /var.
class Appliance : public ::testing::Test {
 protected:
  void SetUp() override;
};

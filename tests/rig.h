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

constexpr const char* SYSTEM_DB = "/var/packages/Camveld/target/system.db";
constexpr const char* CAP_DIR = "/var/packages/Camveld/target/@camveld/@KICapInfo";
constexpr const char* LOG_FILE = "/var/log/camveld/camveld.log";

string ReadFile(const string& strPath);
void WriteFile(const string& strPath, const string& strContent);

struct RUN {
  int Status;        // exit status, as a shell has it
  string strOutput;  // of both streams
};

// The rows of tests/strName: fields parted by tabs, with \ooo for a byte by its octal value.
std::vector<Lines> ReadTable(const string& strName);

// Runs a shell command.
RUN RunCommand(const string& strCommand);

// Runs an SQL text with the sqlite3 shell and returns its rows, columns parted by '|'.
string Sql(const string& strDb, const string& strSqlCmd);

// Runs a program of the build, or the shipped tool, through strace or the like when strWrapper is
// given.
RUN RunProgram(const string& strProgram, const string& strArgs, const string& strWrapper = "");
RUN RunTool(const string& strArgs, const string& strWrapper = "");

// The lines of the package log, without time, process and thread id and line number.
Lines LogLines();

// Receives what is sent to /dev/log while it lives.
class SyslogSocket {
 public:
  SyslogSocket();
  ~SyslogSocket();
  // The records so far, from the message on. Ends the reception.
  Lines Stop();

 private:
  int m_Fd;
  Lines m_Records;
  std::thread m_Reader;
};

// Each test starts with the empty directories of an appliance under /var.
class Appliance : public ::testing::Test {
 protected:
  void SetUp() override;
};

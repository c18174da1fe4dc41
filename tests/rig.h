// What the test programs stand on: a private /var and /dev/log for the whole program, the shipped
// tool run as an installer would run it, and the files it leaves behind.
#pragma once

#include <gtest/gtest.h>

#include <string>
#include <thread>
#include <vector>

constexpr const char* SYSTEM_DB = "/var/packages/Camveld/target/system.db";
constexpr const char* CAP_DIR = "/var/packages/Camveld/target/@camveld/@KICapInfo";
constexpr const char* LOG_FILE = "/var/log/camveld/camveld.log";

std::string ReadFile(const std::string& strPath);
void WriteFile(const std::string& strPath, const std::string& strContent);

struct RUN {
  int Status;             // exit status, as a shell has it
  std::string strOutput;  // of both streams
};

// Runs a shell command.
RUN RunCommand(const std::string& strCommand);

// Runs an SQL text with the sqlite3 shell and returns its rows, columns parted by '|'.
std::string Sql(const std::string& strDb, const std::string& strSqlCmd);

// Runs the shipped tool, through strace or the like when strWrapper is given.
RUN RunTool(const std::string& strArgs, const std::string& strWrapper = "");

// The lines of the package log, without time, process id and line number.
std::vector<std::string> LogLines();

// Receives what is sent to /dev/log while it lives.
class SyslogSocket {
 public:
  SyslogSocket();
  ~SyslogSocket();
  // The records so far, from the message on. Ends the reception.
  std::vector<std::string> Stop();

 private:
  int m_Fd;
  std::vector<std::string> m_Records;
  std::thread m_Reader;
};

// Each test starts with the empty directories of an appliance under /var.
class Appliance : public ::testing::Test {
 protected:
  void SetUp() override;
};

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

// Runs an SQL text on a database and returns its rows, columns parted by '|', rows by line feeds.
std::string Sql(const std::string& strDb, const std::string& strSqlCmd);

// Every cell of every table, with its type.
std::string DumpDb(const std::string& strDb);

// Creates a database from examples/appliance.sql.
void CreateExampleDb(const std::string& strDb);

struct RUN {
  int Status;  // exit status, or 128 plus the signal
  std::string strOutput;
};

// Runs a command, with both of its output streams in strOutput.
RUN RunCommand(std::vector<std::string> Args);

// Runs the shipped tool, through strace or the like when Wrapper is given.
RUN RunTool(const std::vector<std::string>& Args, const std::vector<std::string>& Wrapper = {});

// The lines of the package log, without time and process id.
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

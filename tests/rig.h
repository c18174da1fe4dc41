// What the test programs stand on: a private /var and /dev/log for the whole program, the shipped
// tool run as an installer would run it, and the files it leaves behind.
#pragma once

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <regex>
#include <sstream>
#include <string>
#include <vector>

namespace fs = std::filesystem;
using std::string;
using Lines = std::vector<string>;

const string SYSTEM_DB = "/var/packages/Camveld/target/system.db";
const string CAP_DIR = "/var/packages/Camveld/target/@camveld/@KICapInfo";
const string LOG_FILE = "/var/log/camveld/camveld.log";

inline string ReadFile(const string& strPath) {
  std::ifstream File(strPath, std::ios::binary);
  return string(std::istreambuf_iterator<char>(File), {});
}

inline void WriteFile(const string& strPath, const string& strContent) {
  std::ofstream(strPath, std::ios::binary) << strContent;
}

// The rows of tests/strName: fields parted by tabs, with \ooo for a byte by its octal value.
inline std::vector<Lines> ReadTable(const string& strName) {
  std::ifstream File(TESSEL_SOURCE_DIR "/tests/" + strName);
  std::vector<Lines> Rows;
  for (string strRow; std::getline(File, strRow);) {
    Rows.emplace_back();
    std::istringstream Fields(strRow + '\t');
    for (string strField; std::getline(Fields, strField, '\t');) {
      for (size_t Pos = 0; (Pos = strField.find('\\', Pos)) != string::npos; ++Pos) {
        const int Byte = std::stoi(strField.substr(Pos + 1, 3), nullptr, 8);
        strField.replace(Pos, 4, 1, static_cast<char>(Byte));
      }
      Rows.back().push_back(strField);
    }
  }
  EXPECT_FALSE(Rows.empty()) << strName;
  return Rows;
}

// Runs a shell command in /var and returns what it writes. In it $T is the shipped tool, $P a
// program of the package, $S the sources, $D the database, $C the capability directory and $L the
// log.
inline string RunCommand(const string& strCommand) {
  const string strOutput = "/dev/shm/output-" + std::to_string(gettid());
  const string strPrograms = "\nT='" TESSEL_EMULATOR " " TESSEL_TOOL "' P='" TESSEL_EMULATOR
                             " " TESSEL_CLIENT "' S=" TESSEL_SOURCE_DIR;
  const string strFiles = " D=" + SYSTEM_DB + " C=" + CAP_DIR + " L=" + LOG_FILE + "\ncd /var\n";
  const string strScript = "exec >" + strOutput + " 2>&1" + strPrograms + strFiles + strCommand;
  EXPECT_NE(system(strScript.c_str()), -1);
  return ReadFile(strOutput);
}

// The lines of the package log, without time, process and thread id and line number.
inline Lines LogLines() {
  static const std::regex Prefix(
      R"(^[A-Z][a-z]{2} [ 123]\d \d\d:\d\d:\d\d(\.\d{3})? \[\d+\](\[\d+\])? ?((\[.*?\] )?[^:]*:)\d+:)");
  std::ifstream File(LOG_FILE);
  Lines Log;
  for (string strLine; std::getline(File, strLine);) {
    EXPECT_TRUE(std::regex_search(strLine, Prefix)) << strLine;
    Log.push_back(std::regex_replace(strLine, Prefix, "$3"));
  }
  return Log;
}

// Receives what is sent to /dev/log while it lives. Senders wait when ten records are unread.
class SyslogSocket {
 public:
  SyslogSocket() : m_Fd(socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0)) {
    const sockaddr_un Address = {AF_UNIX, "/dev/log"};
    unlink(Address.sun_path);
    EXPECT_EQ(bind(m_Fd, reinterpret_cast<const sockaddr*>(&Address), sizeof(Address)), 0);
  }
  ~SyslogSocket() { close(m_Fd); }

  // The records since the last call, as "<11> message", without line number.
  Lines Stop() {
    // <11>Nov 24 10:00:00 name: message
    static const std::regex Varying("^(<\\d+>).{16}[^:]*:|:\\d+(?=:)");
    Lines Records;
    char rgRecord[4096];
    for (ssize_t Len; (Len = recv(m_Fd, rgRecord, sizeof(rgRecord), MSG_DONTWAIT)) > 0;) {
      const string strRecord(rgRecord, static_cast<size_t>(Len));
      Records.push_back(std::regex_replace(strRecord, Varying, "$1"));
    }
    return Records;
  }

 private:
  const int m_Fd;
};

// Each test starts with the empty directories of an appliance under /var.
class Appliance : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_FALSE(fs::exists("/var/lib")) << "this is the machine's own /var";
    const string strMkdir = "mkdir -p /var/services/camveld /var/log/camveld $C && echo made";
    ASSERT_EQ(RunCommand("mount -t tmpfs none /var && " + strMkdir), "made\n");
  }
};

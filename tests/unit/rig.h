// What the unit tests share: a private /var that is fresh for each test, its log and its syslog.
#pragma once

#include <gtest/gtest.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <regex>
#include <string>
#include <vector>

namespace fs = std::filesystem;
using Lines = std::vector<std::string>;

constexpr const char* LOG_FILE = "/var/log/camveld/camveld.log";
constexpr const char* SYSTEM_DB = "/var/packages/Camveld/target/system.db";

inline std::string ReadFile(const std::string& strPath) {
  std::ifstream File(strPath, std::ios::binary);
  return {std::istreambuf_iterator<char>(File), {}};
}

inline void WriteFile(const std::string& strPath, const std::string& strText) {
  std::ofstream(strPath, std::ios::binary) << strText;
}

// The lines of the log, without time, process and thread id and line number.
inline Lines LogLines() {
  static const std::regex Prefix(
      R"(^\w{3} [ \d]\d [\d:]{8}(\.\d{3})? \[\d+\](\[\d+\])? ?([^:]*:)-?\d+:)");
  std::ifstream File(LOG_FILE);
  Lines Log;
  std::string strLine;
  while (std::getline(File, strLine)) {
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
  SyslogSocket(const SyslogSocket&) = delete;
  SyslogSocket& operator=(const SyslogSocket&) = delete;

  // The message received since the last call, without time and program name.
  std::string Take() const {
    char rgRecord[4096];
    const ssize_t Len = recv(m_Fd, rgRecord, sizeof(rgRecord), MSG_DONTWAIT);
    const std::string strRecord(rgRecord, Len < 0 ? 0 : static_cast<size_t>(Len));
    return std::regex_replace(strRecord, std::regex("^<11>.{16}[^:]*: "), "");
  }

 private:
  const int m_Fd;
};

// Each test starts with the empty directories of an appliance.
class PrivateVar : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_FALSE(fs::exists("/var/lib")) << "this is the machine's own /var";
    ASSERT_EQ(mount("tmpfs", "/var", "tmpfs", 0, nullptr), 0) << strerror(errno);
    for (const char* szDir : {"log/camveld", "services/camveld", "packages/Camveld/target"}) {
      fs::create_directories(std::string("/var/") + szDir);
    }
  }
  void TearDown() override { umount2("/var", MNT_DETACH); }
};

// What the unit tests share: a private /var that is fresh for each test, and its log.
#pragma once

#include <gtest/gtest.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <regex>
#include <string>

namespace fs = std::filesystem;

constexpr const char* LOG_FILE = "/var/log/camveld/camveld.log";

inline std::string ReadFile(const std::string& strPath) {
  std::ifstream File(strPath, std::ios::binary);
  return {std::istreambuf_iterator<char>(File), {}};
}

inline void WriteFile(const std::string& strPath, const std::string& strText) {
  std::ofstream(strPath, std::ios::binary) << strText;
}

// The text of the log without times, process ids and line numbers, of lines that begin as they
// should.
inline std::string LogText() {
  static const std::regex Parts(R"(\w{3} [ \d]\d [\d:]{8} (\[\d+\]){1,2} ?([^:\n]*:)\d+:)");
  return std::regex_replace(ReadFile(LOG_FILE), Parts, "$2");
}

// Each test starts with the empty directories of an appliance.
class PrivateVar : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_NE(getenv("TESSEL_PRIVATE_VAR"), nullptr) << "start it with tools/private-var";
    ASSERT_EQ(mount("tmpfs", "/var", "tmpfs", 0, nullptr), 0);  // over that of the test before
    for (const char* szDir : {"log/camveld", "services/camveld", "packages/Camveld/target"}) {
      fs::create_directories(std::string("/var/") + szDir);
    }
    WriteFile("/var/packages/Camveld/target/system.db", "");
    umask(0);
    const rlimit Descriptors = {40, 40};  // too few for a call in a loop that leaves one open
    setrlimit(RLIMIT_NOFILE, &Descriptors);
  }
};

// What the unit tests share: a private /var that is fresh for each test, and its log.
#pragma once

#include <gtest/gtest.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <regex>
#include <string>
#include <vector>

namespace fs = std::filesystem;

constexpr const char* LOG_FILE = "/var/log/camveld/camveld.log";
constexpr const char* SYSTEM_DB = "/var/packages/Camveld/target/system.db";

inline std::string ReadFile(const std::string& strPath) {
  std::ifstream File(strPath, std::ios::binary);
  return {std::istreambuf_iterator<char>(File), {}};
}

inline void WriteFile(const std::string& strPath, const std::string& strText) {
  std::ofstream(strPath, std::ios::binary) << strText;
}

// Type and permissions, owner and group.
inline std::vector<unsigned> Rights(const char* szPath) {
  struct stat Stat = {};
  lstat(szPath, &Stat);
  return {Stat.st_mode, Stat.st_uid, Stat.st_gid};
}

struct LogLine {
  std::string strTime;
  std::string strProcess;  // in brackets
  std::string strRest;     // without the line number in front of the function
};

// The lines of a log. A line that does not begin as it should has only a rest.
inline std::vector<LogLine> LogLines(const char* szFile) {
  static const std::regex Parts(R"((\w{3} [ \d]\d [\d:]{8}) ((?:\[\d+\]){1,2}) ?([^:]*:)\d+:(.*))");
  std::vector<LogLine> Lines;
  std::ifstream File(szFile);
  for (std::string strLine; std::getline(File, strLine);) {
    std::smatch Match;
    const bool blWhole = std::regex_match(strLine, Match, Parts);
    Lines.push_back(blWhole ? LogLine{Match[1], Match[2], Match.str(3) + Match.str(4)}
                            : LogLine{"", "", strLine});
  }
  return Lines;
}

// The text of the log, without times, process ids and line numbers.
inline std::string LogText() {
  std::string strText;
  for (const LogLine& Line : LogLines(LOG_FILE)) {
    strText += Line.strRest + "\n";
  }
  return strText;
}

// Each test starts with the empty directories of an appliance.
class PrivateVar : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_NE(getenv("TESSEL_PRIVATE_VAR"), nullptr) << "start it with tools/private-var";
    ASSERT_EQ(mount("tmpfs", "/var", "tmpfs", 0, nullptr), 0);  // over that of the test before
    for (const char* szDir :
         {"log/camveld", "services/camveld", "packages/Camveld/etc", "packages/Camveld/target"}) {
      fs::create_directories(std::string("/var/") + szDir);
    }
    WriteFile(SYSTEM_DB, "");
    umask(0);
    const rlimit Descriptors = {40, 40};  // too few for a call in a loop that leaves one open
    setrlimit(RLIMIT_NOFILE, &Descriptors);
  }
};

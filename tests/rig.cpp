#include "rig.h"

#include <linux/magic.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/vfs.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <regex>
#include <sstream>

namespace fs = std::filesystem;

std::string ReadFile(const std::string& strPath) {
  std::ostringstream Content;
  Content << std::ifstream(strPath, std::ios::binary).rdbuf();
  return Content.str();
}

void WriteFile(const std::string& strPath, const std::string& strContent) {
  std::ofstream(strPath, std::ios::binary) << strContent;
}

std::string Sql(const std::string& strDb, const std::string& strSqlCmd) {
  const RUN Run = RunCommand("sqlite3 -bail " + strDb + " <<'SQL'\n" + strSqlCmd + "\nSQL");
  EXPECT_EQ(Run.Status, 0) << Run.strOutput << " in " << strSqlCmd;
  return Run.strOutput;
}

RUN RunCommand(const std::string& strCommand) {
  RUN Run;
  FILE* pOutput = popen(("exec 2>&1; " + strCommand).c_str(), "r");
  for (int Byte; (Byte = getc(pOutput)) != EOF;) {
    Run.strOutput.push_back(static_cast<char>(Byte));
  }
  Run.Status = WEXITSTATUS(pclose(pOutput));
  return Run;
}

RUN RunTool(const std::string& strArgs, const std::string& strWrapper) {
  return RunCommand(strWrapper + " " TESSEL_EMULATOR " " TESSEL_TOOL " " + strArgs);
}

std::vector<std::string> LogLines() {
  static const std::regex Prefix(
      R"(^[A-Z][a-z]{2} [ 123]\d \d\d:\d\d:\d\d(\.\d{3})? \[\d+\] ([^:]*:)\d+:)");
  std::ifstream Log(LOG_FILE);
  std::vector<std::string> Lines;
  for (std::string strLine; std::getline(Log, strLine);) {
    EXPECT_TRUE(std::regex_search(strLine, Prefix)) << strLine;
    Lines.push_back(std::regex_replace(strLine, Prefix, "$2"));
  }
  return Lines;
}

SyslogSocket::SyslogSocket() : m_Fd(socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0)) {
  const sockaddr_un Address = {AF_UNIX, "/dev/log"};
  unlink(Address.sun_path);
  EXPECT_EQ(bind(m_Fd, reinterpret_cast<const sockaddr*>(&Address), sizeof(Address)), 0);
  m_Reader = std::thread([this] {
    char Record[4096];
    for (ssize_t Len; (Len = recv(m_Fd, Record, sizeof(Record), 0)) > 0;) {
      // <11>Nov 24 10:00:00 name: message
      const std::string strRecord(Record, static_cast<size_t>(Len));
      m_Records.push_back(strRecord.substr(0, 4) + strRecord.substr(strRecord.find(": ") + 1));
    }
  });
}

SyslogSocket::~SyslogSocket() { Stop(); }

std::vector<std::string> SyslogSocket::Stop() {
  if (m_Reader.joinable()) {
    // An empty record, after all that were sent before, ends the reader.
    const int Fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    const sockaddr_un Address = {AF_UNIX, "/dev/log"};
    sendto(Fd, "", 0, 0, reinterpret_cast<const sockaddr*>(&Address), sizeof(Address));
    close(Fd);
    m_Reader.join();
    close(m_Fd);
    unlink(Address.sun_path);
  }
  return m_Records;
}

void Appliance::SetUp() {
  for (const auto& Entry : fs::directory_iterator("/var")) {
    fs::remove_all(Entry);
  }
  fs::create_directories(CAP_DIR);
  fs::create_directories("/var/services/camveld");
  fs::create_directories("/var/log/camveld");
}

// True in a private /var only: the host's is never empty.
static bool IsVarPrivate() {
  struct statfs Stat;
  return statfs("/var", &Stat) == 0 && Stat.f_type == TMPFS_MAGIC && !fs::exists("/var/lib");
}

int main(int argc, char** argv) {
  const std::vector<std::string> Args(argv, argv + argc);
  ::testing::InitGoogleTest(&argc, argv);
  if (::testing::GTEST_FLAG(list_tests) || IsVarPrivate()) {
    return RUN_ALL_TESTS();
  }
  if (getenv("TESSEL_PRIVATE_VAR") != nullptr) {
    fprintf(stderr, "%s: still sees the host's /var, not started\n", argv[0]);
    return 1;
  }
  std::vector<const char*> rgArg = {TESSEL_SOURCE_DIR "/tools/private-var"};
  if (strlen(TESSEL_EMULATOR) != 0) {
    rgArg.push_back(TESSEL_EMULATOR);
  }
  for (const std::string& strArg : Args) {
    rgArg.push_back(strArg.c_str());
  }
  rgArg.push_back(nullptr);
  execv(rgArg[0], const_cast<char**>(rgArg.data()));
  perror(rgArg[0]);
  return 1;
}

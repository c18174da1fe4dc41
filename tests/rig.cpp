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

string ReadFile(const string& strPath) {
  std::ostringstream Content;
  Content << std::ifstream(strPath, std::ios::binary).rdbuf();
  return Content.str();
}

std::vector<Lines> ReadTable(const string& strName) {
  std::ifstream File(TESSEL_SOURCE_DIR "/tests/" + strName);
  std::vector<Lines> Rows;
  for (string strRow; std::getline(File, strRow);) {
    Rows.emplace_back(1);
    for (size_t Pos = 0; Pos < strRow.size(); ++Pos) {
      if (strRow[Pos] == '\t') {
        Rows.back().emplace_back();
      } else if (strRow[Pos] == '\\') {
        Rows.back().back() += static_cast<char>(std::stoi(strRow.substr(Pos + 1, 3), nullptr, 8));
        Pos += 3;
      } else {
        Rows.back().back() += strRow[Pos];
      }
    }
  }
  return Rows;
}

void WriteFile(const string& strPath, const string& strContent) {
  std::ofstream(strPath, std::ios::binary) << strContent;
}

string Sql(const string& strDb, const string& strSqlCmd) {
  const RUN Run = RunCommand("sqlite3 -bail " + strDb + " <<'SQL'\n" + strSqlCmd + "\nSQL");
  EXPECT_EQ(Run.Status, 0) << Run.strOutput << " in " << strSqlCmd;
  return Run.strOutput;
}

RUN RunCommand(const string& strCommand) {
  RUN Run;
  FILE* pOutput = popen(("exec 2>&1; " + strCommand).c_str(), "r");
  for (int Byte; (Byte = getc(pOutput)) != EOF;) {
    Run.strOutput.push_back(static_cast<char>(Byte));
  }
  Run.Status = WEXITSTATUS(pclose(pOutput));
  return Run;
}

RUN RunProgram(const string& strProgram, const string& strArgs, const string& strWrapper) {
  return RunCommand(strWrapper + " " TESSEL_EMULATOR " " + strProgram + " " + strArgs);
}

RUN RunTool(const string& strArgs, const string& strWrapper) {
  return RunProgram(TESSEL_TOOL, strArgs, strWrapper);
}

Lines LogLines() {
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

SyslogSocket::SyslogSocket() : m_Fd(socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0)) {
  const sockaddr_un Address = {AF_UNIX, "/dev/log"};
  unlink(Address.sun_path);
  EXPECT_EQ(bind(m_Fd, reinterpret_cast<const sockaddr*>(&Address), sizeof(Address)), 0);
  m_Reader = std::thread([this] {
    char Record[4096];
    for (ssize_t Len; (Len = recv(m_Fd, Record, sizeof(Record), 0)) > 0;) {
      // <11>Nov 24 10:00:00 name: message
      const string strRecord(Record, static_cast<size_t>(Len));
      m_Records.push_back(strRecord.substr(0, 4) + strRecord.substr(strRecord.find(": ") + 1));
    }
  });
}

SyslogSocket::~SyslogSocket() { Stop(); }

Lines SyslogSocket::Stop() {
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
  const Lines Args(argv, argv + argc);
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
  for (const string& strArg : Args) {
    rgArg.push_back(strArg.c_str());
  }
  rgArg.push_back(nullptr);
  execv(rgArg[0], const_cast<char**>(rgArg.data()));
  perror(rgArg[0]);
  return 1;
}

#include "rig.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <iterator>
#include <regex>
#include <sstream>

string ReadFile(const string& strPath) {
  std::ifstream File(strPath, std::ios::binary);
  return string(std::istreambuf_iterator<char>(File), {});
}

void WriteFile(const string& strPath, const string& strContent) {
  std::ofstream(strPath, std::ios::binary) << strContent;
}

std::vector<Lines> ReadTable(const string& strName) {
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

RUN RunCommand(const string& strCommand) {
  const string strOutput = "/dev/shm/output-" + std::to_string(gettid());
  const int Status = system(("exec >" + strOutput + " 2>&1; " + strCommand).c_str());
  return {WEXITSTATUS(Status), ReadFile(strOutput)};
}

RUN RunProgram(const string& strProgram, const string& strArgs, const string& strWrapper) {
  return RunCommand(strWrapper + " " TESSEL_EMULATOR " " + strProgram + " " + strArgs);
}

string Sql(const string& strDb, const string& strSqlCmd) {
  const RUN Run = RunCommand("sqlite3 -bail " + strDb + " <<'SQL'\n" + strSqlCmd + "\nSQL");
  EXPECT_EQ(Run.Status, 0) << Run.strOutput << " in " << strSqlCmd;
  return Run.strOutput;
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
}

SyslogSocket::~SyslogSocket() { close(m_Fd); }

Lines SyslogSocket::Stop() {
  Lines Records;
  char rgRecord[4096];
  for (ssize_t Len; (Len = recv(m_Fd, rgRecord, sizeof(rgRecord), MSG_DONTWAIT)) > 0;) {
    // <11>Nov 24 10:00:00 name: message
    const std::regex Varying("^(<\\d+>).{16}[^:]*:|:\\d+(?=:)");
    Records.push_back(
        std::regex_replace(string(rgRecord, static_cast<size_t>(Len)), Varying, "$1"));
  }
  return Records;
}

void Appliance::SetUp() {
  ASSERT_FALSE(fs::exists("/var/lib")) << "this is the machine's own /var";
  const string strMkdir = "mkdir -p /var/services/camveld /var/log/camveld " + CAP_DIR;
  ASSERT_EQ(RunCommand("mount -t tmpfs none /var && " + strMkdir).Status, 0);
}

// The log writer and the file lock.

#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <fstream>
#include <map>
#include <regex>

#include "kidebuglog.h"
#include "kiflock.h"
#include "rig.h"
#include "utils.h"

using std::chrono::milliseconds;
using std::chrono::steady_clock;

namespace {

class Log : public Appliance {};

TEST_F(Log, LineHasEachFieldInItsPlace) {
  const string strLong(100000, 'x');
  const char* szLong = strLong.c_str();
  KiPrintf(KI_LOG, nullptr, nullptr, "a/b\\c.cpp", 7, "Fn", "v=%d %%\n", 5);
  KiPrintf(KI_LOG, "utils", "error", "name", -1, "Fn", "1\n");
  KiPrintf(KI_LOG, "utils", nullptr, "dir/", 2, "Fn", "no line feed ");
  KiPrintf(KI_LOG, nullptr, "error", "/x", 3, "Fn", "\n");
  std::thread([=] { KiPrintf(KI_LOG, "c", "l", "f", 4, "Fn", "%s\n", szLong); }).join();
  KiPrintf(NOTIFICATION_LOG, nullptr, nullptr, "f", 5, "Fn", "other\n");

  const string strPid = "[" + itos(getpid()) + "]";
  std::smatch Match;
  string strLog = ReadFile(LOG_FILE) + ReadFile("/var/log/camveld/kinotification.log");
  const std::regex Tid("(\\[\\d+\\])\\[c\\]"), Time("[A-Z][a-z]{2} [ 123]\\d( \\d\\d|:\\d\\d){3} ");
  ASSERT_TRUE(std::regex_search(strLog, Match, Tid));
  EXPECT_NE(Match[1], strPid);
  strLog = std::regex_replace(std::regex_replace(strLog, Time, "TIME "), Tid, "[TID][c]");
  for (size_t Pos; (Pos = strLog.find(strPid)) != string::npos;) {
    strLog.replace(Pos, strPid.size(), "PID");
  }
  EXPECT_EQ(strLog,
            "TIME PID c.cpp:7:Fn(): v=5 %\nTIME PID[utils][error] name:-1:Fn(): 1\n"
            "TIME PID :2:Fn(): no line feed TIME PID x:3:Fn(): \n"
            "TIME PID[TID][c][l] f:4:Fn(): " +
                strLong + "\nTIME PID f:5:Fn(): other\n");
}

TEST_F(Log, LostLinesGoToSyslog) {
  SyslogSocket Syslog;
  KiPrintf(static_cast<LOG_TYPE>(2), nullptr, nullptr, "f", 1, "Fn", "x\n");
  fs::remove_all("/var/log/camveld");
  KiPrintf(KI_LOG, nullptr, nullptr, "f", 1, "Fn", "x\n");
  EXPECT_EQ(RunTool("2475").Status, 0);
  string strRecords;
  for (const string& strRecord : Syslog.Stop()) {
    strRecords += std::regex_replace(strRecord, std::regex(":\\d+:"), ":LINE:") + "\n";
  }
  const string strRecord =
      "<11> libkimodule/lib/kidebuglog.cpp:LINE:KiPrintf(): open kilog file failed with errno ";
  EXPECT_EQ(strRecords, strRecord + "[22].\n" + strRecord + "[2].\n" + strRecord + "[2].\n");
  EXPECT_FALSE(fs::exists("/var/log/camveld"));
}

TEST_F(Log, LinesOfTwoProcessesStayWhole) {
  constexpr int Lines = 10000;
  const pid_t Pid = fork();
  for (int Line = 0; Line < Lines; ++Line) {
    KiPrintf(KI_LOG, nullptr, nullptr, "f", 1, "Fn", "%d %0*d\n", Line, 1 + Line % 300, 0);
  }
  if (Pid == 0) {
    _exit(0);
  }
  waitpid(Pid, nullptr, 0);
  std::map<string, int> NextOfPid;
  std::ifstream LogStream(LOG_FILE);
  const std::regex Whole(R"(\w{3} [ 123]\d [\d:]{8} \[(\d+)\] f:1:Fn\(\): (\d+) (0+))");
  for (string strLine; std::getline(LogStream, strLine);) {
    std::smatch Match;
    ASSERT_TRUE(std::regex_match(strLine, Match, Whole)) << strLine;
    EXPECT_EQ(NextOfPid[Match[1]]++, std::stoi(Match[2]));
    EXPECT_EQ(Match[3].length(), 1 + std::stoi(Match[2]) % 300);
  }
  EXPECT_EQ(NextOfPid[itos(getpid())], Lines);
  EXPECT_EQ(NextOfPid[itos(Pid)], Lines);
}

TEST_F(Log, HeldLogDelaysTheToolAndLosesNothing) {
  const auto Start = steady_clock::now();
  RunCommand(string("L=") + LOG_FILE + "; flock $L sleep 1 >/dev/null 2>&1 & sleep 0.1;" +
             "while flock -n $L true; do :; done");
  EXPECT_EQ(RunTool("2475").Status, 0);
  EXPECT_GE(steady_clock::now() - Start, milliseconds(900));
  EXPECT_EQ(LogLines().size(), 1u);
}

TEST_F(Log, LockWaitsAsLongAsItIsTold) {
  const string strFile = "/var/lock-me";
  umask(0);
  KiFlock Held(strFile), Other(strFile);
  Held.UnLock();
  ASSERT_EQ(Held.LockSh(0), 0);
  struct stat Stat;
  ASSERT_EQ(stat(strFile.c_str(), &Stat), 0);
  EXPECT_EQ(Stat.st_mode & 07777, 0644u);
  EXPECT_EQ(Other.LockSh(0), 0);  // readers go together
  EXPECT_EQ(Held.LockEx(0), -1);
  EXPECT_EQ(errno, EWOULDBLOCK);
  Other.UnLock();
  EXPECT_EQ(Held.LockEx(0), 0);  // converts the lock it has

  const auto Start = steady_clock::now();
  EXPECT_EQ(Other.LockSh(1), -1);
  EXPECT_EQ(errno, EWOULDBLOCK);
  EXPECT_NEAR(std::chrono::duration<double>(steady_clock::now() - Start).count(), 1.05, 0.3);
  std::thread Waiter([&] { EXPECT_EQ(Other.LockEx(-1), 0); });
  usleep(200000);
  Held.UnLock();
  Waiter.join();
  EXPECT_EQ(KiFlock("/var/missing/file").LockEx(-1), -1);
  EXPECT_EQ(errno, ENOENT);
}

}  // namespace

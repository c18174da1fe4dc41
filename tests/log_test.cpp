// The log writer and the file lock.

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
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

std::string OnlyLine() {
  const std::string strLog = ReadFile(LOG_FILE);
  std::filesystem::remove(LOG_FILE);
  return strLog;
}

TEST_F(Log, LineHasEachFieldInItsPlace) {
  const std::string strTime = "[A-Z][a-z]{2} [ 123]\\d \\d\\d:\\d\\d:\\d\\d ";
  const std::string strPid = "\\[" + itos(getpid()) + "\\]";
  const struct {
    const char *szCateg, *szLevel, *szFile;
    std::string strExpected;  // after the pid
  } rgCase[] = {
      {nullptr, nullptr, "a/b\\c.cpp", " c.cpp:7:Fn\\(\\): v=5 %\n"},
      {"utils", "error", "name", "\\[utils\\]\\[error\\] name:7:Fn\\(\\): v=5 %\n"},
      {"utils", nullptr, "dir/", " :7:Fn\\(\\): v=5 %\n"},
      {nullptr, "error", "/x", " x:7:Fn\\(\\): v=5 %\n"},
  };
  for (const auto& Case : rgCase) {
    KiPrintf(KI_LOG, Case.szCateg, Case.szLevel, Case.szFile, 7, "Fn", "v=%d %%\n", 5);
    const std::string strLine = OnlyLine();
    EXPECT_TRUE(std::regex_match(strLine, std::regex(strTime + strPid + Case.strExpected)))
        << strLine;
  }
  std::thread([] { KiPrintf(KI_LOG, nullptr, nullptr, "f", 1, "Fn", "x\n"); }).join();
  EXPECT_TRUE(std::regex_match(OnlyLine(), std::regex(strTime + strPid + "\\[(?!" + itos(getpid()) +
                                                      "\\])\\d+\\] f:1.*\n")));
  const std::string strLong(100000, 'x');
  KiPrintf(NOTIFICATION_LOG, nullptr, nullptr, "f", 1, "Fn", "%s", strLong.c_str());
  EXPECT_NE(ReadFile("/var/log/camveld/kinotification.log").find("): " + strLong),
            std::string::npos);
}

TEST_F(Log, LostLinesGoToSyslog) {
  const auto Record = [](const std::string& strStep, int Errno) {
    return "<11> libkimodule/lib/kidebuglog\\.cpp:\\d+:KiPrintf\\(\\): " + strStep +
           " kilog file failed with errno \\[" + itos(Errno) + "\\]\\.";
  };
  SyslogSocket Syslog;
  KiPrintf(static_cast<LOG_TYPE>(2), nullptr, nullptr, "f", 1, "Fn", "x\n");
  std::filesystem::remove_all("/var/log/camveld");
  KiPrintf(KI_LOG, nullptr, nullptr, "f", 1, "Fn", "x\n");
  EXPECT_EQ(RunTool({"2475"}).Status, 0);
  const std::vector<std::string> Records = Syslog.Stop();
  ASSERT_EQ(Records.size(), 3u);
  EXPECT_TRUE(std::regex_match(Records[0], std::regex(Record("open", EINVAL)))) << Records[0];
  EXPECT_TRUE(std::regex_match(Records[1], std::regex(Record("open", ENOENT)))) << Records[1];
  EXPECT_EQ(Records[1], Records[2]);
  EXPECT_FALSE(std::filesystem::exists("/var/log/camveld"));
}

TEST_F(Log, LinesOfTwoProcessesStayWhole) {
  constexpr int Lines = 10000;
  const pid_t rgPid[] = {fork(), fork()};  // four processes: two write twice as much
  for (int Line = 0; Line < Lines / 2; ++Line) {
    KiPrintf(KI_LOG, nullptr, nullptr, "f", 1, "Fn", "%d %s\n", Line,
             std::string(static_cast<size_t>(Line % 300), 'x').c_str());
  }
  for (const pid_t Pid : rgPid) {
    if (Pid > 0) {
      waitpid(Pid, nullptr, 0);
    }
  }
  if (rgPid[0] == 0 || rgPid[1] == 0) {
    _exit(0);
  }
  std::map<std::string, int> NextOfPid;
  std::ifstream LogStream(LOG_FILE);
  const std::regex Whole(R"(\w{3} [ 123]\d [\d:]{8} \[(\d+)\] f:1:Fn\(\): (\d+) (x*))");
  std::string strLastTime;
  for (std::string strLine; std::getline(LogStream, strLine);) {
    std::smatch Match;
    ASSERT_TRUE(std::regex_match(strLine, Match, Whole)) << strLine;
    EXPECT_EQ(NextOfPid[Match[1]]++, std::stoi(Match[2]));
    EXPECT_EQ(Match[3].length(), std::stoi(Match[2]) % 300);
  }
  EXPECT_EQ(NextOfPid.size(), 4u);
  for (const auto& [strPid, Next] : NextOfPid) {
    EXPECT_EQ(Next, Lines / 2) << strPid;
  }
}

TEST_F(Log, HeldLogDelaysTheToolAndLosesNothing) {
  WriteFile(LOG_FILE, "");
  const auto Start = steady_clock::now();
  std::thread Holder([] { RunCommand({"flock", LOG_FILE, "sleep", "1"}); });
  while (KiFlock(LOG_FILE).LockEx(0) == 0) {
    usleep(1000);
  }
  EXPECT_EQ(RunTool({"2475"}).Status, 0);
  EXPECT_GE(steady_clock::now() - Start, milliseconds(900));
  Holder.join();
  EXPECT_EQ(LogLines().size(), 1u);
}

TEST_F(Log, LockWaitsAsLongAsItIsTold) {
  const std::string strFile = "/var/lock-me";
  const mode_t OldMask = umask(0);
  KiFlock Held(strFile);
  Held.UnLock();
  ASSERT_EQ(Held.LockSh(0), 0);
  umask(OldMask);
  struct stat Stat;
  ASSERT_EQ(stat(strFile.c_str(), &Stat), 0);
  EXPECT_EQ(Stat.st_mode & 07777, 0644u);

  KiFlock Other(strFile);
  EXPECT_EQ(Other.LockSh(0), 0);  // readers go together
  EXPECT_EQ(Held.LockEx(0), -1);
  EXPECT_EQ(errno, EWOULDBLOCK);
  Other.UnLock();
  EXPECT_EQ(Held.LockEx(0), 0);  // converts the lock it has

  const auto Start = steady_clock::now();
  EXPECT_EQ(Other.LockSh(1), -1);
  EXPECT_EQ(errno, EWOULDBLOCK);
  EXPECT_NEAR(std::chrono::duration<double>(steady_clock::now() - Start).count(), 1.05, 0.2);
  std::thread Waiter([&] { EXPECT_EQ(Other.LockEx(-1), 0); });
  usleep(200000);
  { const KiFlock Moved(std::move(strFile)); }
  Held.UnLock();
  Waiter.join();
  EXPECT_EQ(KiFlock("/var/missing/file").LockEx(-1), -1);
  EXPECT_EQ(errno, ENOENT);
}

}  // namespace

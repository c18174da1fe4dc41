// The log writer and the file lock.

#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <regex>

#include "kidebuglog.h"
#include "kiflock.h"
#include "rig.h"
#include "utils.h"

namespace {

class Log : public Appliance {};

TEST_F(Log, LineHasEachFieldInItsPlace) {
  const string strLong(100000, 'x');
  KiPrintf(KI_LOG, nullptr, nullptr, "a/b\\c.cpp", 7, "Fn", "v=%d %%\n", 5);
  KiPrintf(KI_LOG, "utils", "error", "name", -1, "Fn", "1\n");
  KiPrintf(KI_LOG, "utils", nullptr, "dir/", 2, "Fn", "no line feed ");
  KiPrintf(KI_LOG, nullptr, "error", "/x", 3, "Fn", "\n");
  std::thread([&] { KiPrintf(KI_LOG, "c", "l", "f", 4, "Fn", "%s\n", strLong.c_str()); }).join();
  KiPrintf(NOTIFICATION_LOG, nullptr, nullptr, "f", 5, "Fn", "other\n");
  // The start is "@", and "@[]" where a thread id follows.
  const string strPid = itos(getpid()) + "]",
               strTime = "[A-Z][a-z]{2} [ 123]\\d( \\d\\d|:\\d\\d){3} ";
  const std::regex Start(strTime + "\\[" + strPid + "(\\[(?!" + strPid + "))?\\d*(])?");
  const string strLog = ReadFile(LOG_FILE) + ReadFile("/var/log/camveld/kinotification.log");
  EXPECT_EQ(std::regex_replace(strLog, Start, "@$2$3"),
            "@ c.cpp:7:Fn(): v=5 %\n@[utils][error] name:-1:Fn(): 1\n@ :2:Fn(): no line feed "
            "@ x:3:Fn(): \n@[][c][l] f:4:Fn(): " +
                strLong + "\n@ f:5:Fn(): other\n");
}

TEST_F(Log, LostLinesGoToSyslog) {
  SyslogSocket Syslog;
  KiPrintf(static_cast<LOG_TYPE>(2), nullptr, nullptr, "f", 1, "Fn", "x\n");
  fs::remove_all("/var/log/camveld");
  KiPrintf(KI_LOG, nullptr, nullptr, "f", 1, "Fn", "x\n");
  EXPECT_EQ(RunTool("2475").Status, 0);
  const string strOpen =
      "<11> libkimodule/lib/kidebuglog.cpp:KiPrintf(): open kilog file failed with errno ";
  EXPECT_EQ(Syslog.Stop(), (Lines{strOpen + "[22].", strOpen + "[2].", strOpen + "[2]."}));
  EXPECT_FALSE(fs::exists("/var/log/camveld"));
}

TEST_F(Log, LinesOfTwoProcessesStayWholeAndInOrder) {
  string strWritten;
  const pid_t Pid = fork();
  for (int Line = 0; Line < 10000; ++Line) {
    const string strLine = itos(Line) + string(static_cast<size_t>(Line % 300), '.') + "\n";
    KiPrintf(KI_LOG, nullptr, nullptr, "f", 1, "Fn", "%s", strLine.c_str());
    strWritten += strLine;
  }
  if (Pid == 0) {
    _exit(0);
  }
  waitpid(Pid, nullptr, 0);
  for (const pid_t Writer : {Pid, getpid()}) {
    const string strSed = "sed -n 's/^[A-Z].\\{14\\} \\[" + itos(Writer) + "\\] f:1:Fn(): //p' ";
    EXPECT_EQ(RunCommand(strSed + LOG_FILE).strOutput, strWritten);
  }
}

TEST_F(Log, HeldLogDelaysTheToolAndLosesNothing) {
  const string strHold = "flock $L -c \"sleep 1; wc -c <$L\" & while flock -n $L true; do :; done;";
  EXPECT_EQ(RunTool("2475; wait", "L=" + LOG_FILE + "; " + strHold).strOutput, "0\n");
  EXPECT_EQ(LogLines().size(), 1u);
}

TEST_F(Log, LockWaitsAsLongAsItIsTold) {
  umask(0);
  KiFlock Held("/var/file"), Other("/var/file");
  Held.UnLock();
  EXPECT_EQ(Held.LockSh(0) + Other.LockSh(0), 0);  // readers go together
  EXPECT_EQ(RunCommand("stat -c %a /var/file").strOutput, "644\n");
  EXPECT_EQ(Held.LockEx(0) == -1 ? errno : 0, EWOULDBLOCK);
  Other.UnLock();
  EXPECT_EQ(Held.LockEx(0), 0);  // converts the lock it has
  const auto Start = std::chrono::steady_clock::now();
  EXPECT_EQ(Other.LockSh(1) == -1 ? errno : 0, EWOULDBLOCK);
  EXPECT_NEAR(std::chrono::duration<double>(std::chrono::steady_clock::now() - Start).count(), 1.05,
              0.3);
  std::thread Waiter([&] { EXPECT_EQ(Other.LockEx(-1), 0); });
  usleep(200000);
  Held.UnLock();
  Waiter.join();
  EXPECT_EQ(KiFlock("/var/missing/file").LockEx(-1) == -1 ? errno : 0, ENOENT);
}

}  // namespace

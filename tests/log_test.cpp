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
  KiPrintf(KI_LOG, nullptr, nullptr, "f", 6, "Fn", "cut %ls", L"\u00e9");  // not of this locale
  KiPrintf(NOTIFICATION_LOG, nullptr, nullptr, "f", 5, "Fn", "other\n");
  // The start is "@", and "@[]" where a thread id follows.
  const string strPid = itos(getpid()) + "]",
               strTime = "[A-Z][a-z]{2} [ 123]\\d( \\d\\d|:\\d\\d){3} ";
  const std::regex Start(strTime + "\\[" + strPid + "(\\[(?!" + strPid + "))?\\d*(])?");
  const string strLog = ReadFile(LOG_FILE) + ReadFile("/var/log/camveld/kinotification.log");
  EXPECT_EQ(std::regex_replace(strLog, Start, "@$2$3"),
            "@ c.cpp:7:Fn(): v=5 %\n@[utils][error] name:-1:Fn(): 1\n@ :2:Fn(): no line feed "
            "@ x:3:Fn(): \n@[][c][l] f:4:Fn(): " +
                strLong + "\n@ f:6:Fn(): cut @ f:5:Fn(): other\n");
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

// While the log is rotated and some of the writers are killed.
TEST_F(Log, LinesOf64WritersStayWholeAndInOrder) {
  RunProgram(TESSEL_CLIENT, "create");
  InitDbgCfg();
  g_pDbgLogCfg->SetLogInMs(true);
  WriteFile("/var/conf", LOG_FILE + " {\nrotate 1000\nnocreate\nmissingok\n}\n");
  const auto WriteLines = [](int Thread) {
    for (int Line = 0; Line < 1000; ++Line) {
      KiPrintf(KI_LOG, nullptr, nullptr, "f", Thread, "Fn", "%d %0*d\n", Line, Line % 300 + 1, 0);
    }
  };
  string strAlive = "grep", strExpected;
  for (int Process = 0; Process < 16; ++Process) {
    const pid_t Pid = fork();
    if (Pid == 0) {
      std::thread Threads[] = {std::thread(WriteLines, 0), std::thread(WriteLines, 1),
                               std::thread(WriteLines, 2), std::thread(WriteLines, 3)};
      for (std::thread& Thread : Threads) {
        Thread.join();
      }
      _exit(0);
    }
    if (Process % 4 == 0) {
      usleep(10000);
      kill(Pid, SIGKILL);
    } else {
      strAlive += " -e ' " + itos(Pid) + " '";
      strExpected += "4 " + itos(Pid) + " 1000\n";
    }
  }
  while (waitpid(-1, nullptr, WNOHANG) != -1) {
    EXPECT_EQ(RunCommand("sleep 0.1; logrotate -f -s /var/state /var/conf").strOutput, "");
  }
  EXPECT_EQ(KiFlock(LOG_FILE).LockEx(0), 0);
  const string strCheck = R"(cd /var/log/camveld
    for file in *; do cut -c 1-19 $file | sort -c; done
    cat $(ls -rv) | sed -E 's/^.{19} \[([0-9]+)]\[[0-9]+] f:([0-3]):Fn\(\): /\1 \2 /' |
      awk '$3 + 0 != next_of[$1, $2]++ || length($4) != $3 % 300 + 1 || NF != 4
        END { for (writer in next_of) print substr(writer, 1, length(writer) - 2), next_of[writer] }' |
      sort -n | uniq -c | sed 's/^ *//' | )";
  EXPECT_EQ(RunCommand(strCheck + strAlive).strOutput, strExpected);
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

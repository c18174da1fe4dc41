// The log: its writer and file lock, categories and levels, and the shared configuration that
// decides which messages are written.

#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <thread>

#include "kidebuglog.h"
#include "kiflock.h"
#include "rig.h"
#include "utils.h"

namespace {

class Log : public Appliance {};

LOG_CATEG Categ(int Value) { return static_cast<LOG_CATEG>(Value); }
LOG_LEVEL Level(int Value) { return static_cast<LOG_LEVEL>(Value); }

// Attaches a segment that is made as another program makes it, by its key and size.
void Create(int Mode) {
  RunCommand("ipcrm -M 0x18180004");
  EXPECT_NE(shmget(0x18180004, 2568, IPC_CREAT | Mode), -1);
  InitDbgCfg();
}

TEST_F(Log, LineHasEachFieldInItsPlace) {
  const string strLong(5000, 'x');
  std::thread([&] { KiPrintf(KI_LOG, "c", "l", "f", 4, "Fn", "%s\n", strLong.c_str()); }).join();
  KiPrintf(KI_LOG, "utils", "error", "a/b\\c.cpp", 7, "Fn", "v=%d %%\n", 5);
  KiPrintf(KI_LOG, "utils", nullptr, "dir/", 2, "Fn", "\n");
  KiPrintf(KI_LOG, nullptr, "error", "/f", 6, "Fn", "cut %ls", L"\u00e9");  // not of this locale
  KiPrintf(NOTIFICATION_LOG, nullptr, nullptr, "f", -1, "Fn", "other");
  EXPECT_EQ(LogLines(), (Lines{"[c][l] f:Fn(): " + strLong, "[utils][error] c.cpp:Fn(): v=5 %",
                               ":Fn(): ", "f:Fn(): cut "}));
  const string strCut = "cut -c 16- /var/log/camveld/kinotification.log";
  EXPECT_EQ(RunCommand(strCut), " [" + itos(getpid()) + "] f:-1:Fn(): other\n");
}

TEST_F(Log, LostLinesGoToSyslog) {
  SyslogSocket Syslog;
  KiPrintf(static_cast<LOG_TYPE>(2), nullptr, nullptr, "f", 1, "Fn", "x\n");
  fs::remove_all("/var/log/camveld");
  EXPECT_EQ(RunCommand("$T 2475; echo $?"), "0\n");
  const string strOpen =
      "<11> libkimodule/lib/kidebuglog.cpp:KiPrintf(): open kilog file failed with errno ";
  EXPECT_EQ(Syslog.Stop(), (Lines{strOpen + "[22].", strOpen + "[2]."}));
  EXPECT_FALSE(fs::exists("/var/log/camveld"));
}

TEST_F(Log, ErrnoIsTheCallersInTheMessageAndAfterIt) {
  const string strLong(2000, 'x');
  const string strFormat = "%s: %m\n";  // no literal: compilers take %m for an extension
  const auto WriteLine = [&](LOG_TYPE Type, const string& strText) {
    errno = ENOENT;
    KiPrintf(Type, nullptr, nullptr, "f", 1, "Fn", strFormat.c_str(), strText.c_str());
    EXPECT_EQ(errno, ENOENT) << Type << strText;
    errno = EACCES;
    KiDbgPrintf(LOG_CATEG_UTILS, LOG_LEVEL_INFO, "f", 1, "Fn", strFormat.c_str(), strText.c_str());
    EXPECT_EQ(errno, EACCES) << strText;
  };
  WriteLine(KI_LOG, "short");
  WriteLine(KI_LOG, strLong);
  const string strUtils = "[utils][info] f:Fn(): ";
  EXPECT_EQ(LogLines(), (Lines{"f:Fn(): short: No such file or directory",
                               strUtils + "short: Permission denied",
                               "f:Fn(): " + strLong + ": No such file or directory",
                               strUtils + strLong + ": Permission denied"}));
  WriteLine(static_cast<LOG_TYPE>(2), "a type without a path");
  fs::remove_all("/var/log/camveld");
  WriteLine(KI_LOG, "a log that cannot be opened");
}

// While the log is rotated and some of the writers are killed.
TEST_F(Log, LinesOf64WritersStayWholeAndInOrder) {
  Create(0666);
  g_pDbgLogCfg->SetLogInMs(true);
  WriteFile("/var/conf", LOG_FILE + " {\nrotate 1000\nnocreate\nmissingok\n}\n");
  for (int Process = 0; Process < 16; ++Process) {
    const bool blKilled = Process % 4 == 0;
    const auto WriteLines = [blKilled](int Thread) {
      for (int Line = 0; Line < 1000 || blKilled; ++Line) {
        KiPrintf(KI_LOG, nullptr, nullptr, "f", Thread, "Fn", "%d %0*d\n", Line, Line % 300 + 1, 0);
      }
    };
    const pid_t Pid = fork();
    if (Pid == 0) {
      std::thread Threads[] = {std::thread(WriteLines, 0), std::thread(WriteLines, 1),
                               std::thread(WriteLines, 2), std::thread(WriteLines, 3)};
      for (std::thread& Thread : Threads) {
        Thread.join();
      }
      _exit(0);
    }
    usleep(blKilled ? 10000 : 0);
    kill(Pid, blKilled ? SIGKILL : 0);
  }
  while (waitpid(-1, nullptr, WNOHANG) != -1) {
    EXPECT_EQ(RunCommand("sleep 0.1; logrotate -f -s /var/state /var/conf"), "");
  }
  EXPECT_EQ(KiFlock(LOG_FILE).LockEx(0), 0);
  const string strCheck = R"(cd /var/log/camveld
    for file in *; do cut -c 1-19 $file | sort -c; done
    cat $(ls -rv) | sed -E 's/^.{19} \[([0-9]+)]\[[0-9]+] f:([0-3]):Fn\(\): /\1 \2 /' |
      awk '$3 + 0 != next_of[$1, $2]++ || length($4) != $3 % 300 + 1 || NF != 4
        END { for (writer in next_of) complete += next_of[writer] == 1000; print complete }')";
  EXPECT_EQ(RunCommand(strCheck), "48\n");
}

TEST_F(Log, LockWaitsAsLongAsItIsTold) {
  KiFlock Held("/var/file"), Other("/var/file");
  umask(0);
  EXPECT_EQ(Held.LockSh(0) + Other.LockSh(0), 0);  // readers go together
  EXPECT_EQ(RunCommand("stat -c %a /var/file"), "644\n");
  EXPECT_EQ(Held.LockEx(0) == -1 ? errno : 0, EWOULDBLOCK);
  Other.UnLock();
  EXPECT_EQ(Held.LockEx(0), 0);  // converts the lock it has
  const int64_t usecStart = GetCurTimestamp();
  EXPECT_EQ(Other.LockSh(1) == -1 ? errno : 0, EWOULDBLOCK);
  EXPECT_NEAR(static_cast<double>(GetCurTimestamp() - usecStart), 2e6, 1.1e6);
  EXPECT_EQ(KiFlock("/var/missing/file").LockEx(-1) == -1 ? errno : 0, ENOENT);
}

// Opens the file, which is a cancellation point, then waits for it, which is none.
void WaitForLock(std::atomic<int>* pSteps) {
  KiFlock Lock("/var/file");
  Lock.LockEx(0);
  ++*pSteps;
  Lock.LockEx(-1);
}

TEST_F(Log, CancelledWaiterReleasesTheLockBeforeItEnds) {
  static std::atomic<int> Steps;
  const auto Wait = [](void*) -> void* {
    WaitForLock(&Steps);
    ++Steps;
    pthread_testcancel();
    ++Steps;
    return nullptr;
  };
  for (int Round = 0; Round < 100; ++Round) {
    KiFlock Held("/var/file");
    pthread_t Thread;
    Steps = 0;
    ASSERT_EQ(Held.LockEx(0), 0) << "round " << Round;
    ASSERT_EQ(pthread_create(&Thread, nullptr, Wait, nullptr), 0);
    while (Steps == 0) {
      usleep(100);
    }
    pthread_cancel(Thread);
    Held.UnLock();
    pthread_join(Thread, nullptr);
    ASSERT_EQ(Steps, 2) << "round " << Round;
  }
}

// The switch, each category whose threshold is not that of the one before it, and the processes.
string Show(const KiDbgLogCfg& Cfg = *g_pDbgLogCfg) {
  string strLevels = Cfg.LogInMs() ? "ms" : "s", strPids;
  LOG_LEVEL Last = LOG_LEVEL_ALARM, Next = Last;
  pid_t Pid = 0;
  for (int Idx = -1; Idx <= LOG_CATEG_MAX; ++Idx, Last = Next) {
    strPids += Cfg.GetPidLevel(Idx, Pid, Next) == 0 ? " " + itos(Pid) + "=" + itos(Next) : "";
    Next = Cfg.GetLogLevel(Categ(Idx));
    strLevels += Next == Last ? "" : " " + itos(Idx) + ":" + itos(Next);
  }
  return strLevels + strPids;
}

TEST_F(Log, ConfigurationStaysInsideItsMemoryAndItsSettingsOutlastIt) {
  const string strDir = "/var/packages/Camveld/etc/", strFile = strDir + "settings.conf";
  Create(0666);
  auto* const pWords = reinterpret_cast<int32_t*>(g_pDbgLogCfg);  // [513] is the count
  for (int Pid = 1; Pid <= 65; ++Pid) {
    g_pDbgLogCfg->SetPidLevel(Pid, LOG_LEVEL_DEBUG);
  }
  pWords[513] = 65;
  g_pDbgLogCfg->SetPidLevel(64, LOG_LEVEL_ERROR);
  g_pDbgLogCfg->SetPidLevel(65, LOG_LEVEL_ERROR);
  g_pDbgLogCfg->ClearPid(65);
  g_pDbgLogCfg->ClearPid(1);
  EXPECT_EQ(Show(), "s" + RunCommand("printf ' %d=5' $(seq 2 63)") + " 64=1");
  pWords[513] = -1;
  pWords[0] = 2;
  g_pDbgLogCfg->SetPidLevel(7, LOG_LEVEL_INFO);
  for (const int Value : {-1, 511, 512}) {  // the neighbours are the switch and the count
    g_pDbgLogCfg->SetLogLevel(Categ(Value), Level(256));
  }
  EXPECT_EQ(Show(), "ms 511:256 512:0 7=4");
  EXPECT_EQ(pWords[642] | pWords[643], 0);
  EXPECT_EQ(g_pDbgLogCfg->LoadDbgLogSettings() + g_pDbgLogCfg->SaveDbgLogSettings(), -2);
  RunCommand("$P create");
  EXPECT_EQ(Show(), "s 0:3 88:0 511:256 512:0");
  fs::create_directories(strDir);
  WriteFile(strFile, "ki_dbglog_settings=x,2,-3,,99\nki_dbglog_time_scale=yes\nzone=x");
  RunCommand("$P create");
  EXPECT_EQ(Show(), "ms 1:2 2:-3 3:99 4:3 88:0 511:256 512:0");
  EXPECT_EQ(g_pDbgLogCfg->SaveDbgLogSettings(), 0);
  EXPECT_EQ(RunCommand("sed -E 's/3(,3){83}/3*84/' " + strFile),
            "ki_dbglog_settings=\"0,2,-3,99,3*84\"\nki_dbglog_time_scale=\"yes\"\nzone=\"x\"\n");
  WriteFile(strFile, "ki_dbglog_time_scale=Yes");
  EXPECT_EQ(g_pDbgLogCfg->LoadDbgLogSettings() + g_pDbgLogCfg->SaveDbgLogSettings(), 1);
  EXPECT_EQ(RunCommand("tail -n 1 " + strFile), "ki_dbglog_time_scale=\"no\"\n");
}

TEST_F(Log, ProgramsObeyTheConfigurationThatTheyCanAttach) {
  Create(0);
  g_pDbgLogCfg->SetLogInMs(true);
  EXPECT_EQ(RunCommand("setpriv --bounding-set -all $P log 52 7; $P log 52 0; $T 2475"),
            "00000110");  // before main, in it, after it, at the very end
  const string strSed = R"(sed -E 's/.{15}(\S*) .\w+.(\[event..)?(\w*).*/\1\3/; s/[0-9]{3}/ms/' )";
  EXPECT_EQ(RunCommand(strSed + LOG_FILE), "debug3\n.msalarm\n.ms\n");
}

TEST_F(Log, GateAsksTheCategoryThenTheProcess) {
  Create(0666);
  int Own = getpid(), Written = 0;
  // The threshold of the category, of which process, and how many messages there are then.
  const int rgCase[][4] = {{99, 1, 7, 8},   {3, 1, 7, 12},    {-1, 1, 7, 13},
                           {3, Own, 4, 18}, {3, Own, -1, 22}, {-1, Own, -1, 22}};
  for (const auto& [Threshold, Pid, PidThreshold, Expected] : rgCase) {
    g_pDbgLogCfg->SetLogLevel(LOG_CATEG_EVENT, Level(Threshold));
    g_pDbgLogCfg->SetPidLevel(Pid, Level(PidThreshold));
    for (int Value = 0; Value < LOG_LEVEL_TOTAL; ++Value) {
      errno = 42;
      KIDBGLOG(LOG_CATEG_EVENT, Level(Value), "errno %d, %d\n", errno, ++Written);
    }
    EXPECT_EQ(Written, Expected);
  }
  const string strSed = "sed -nE '1,8s/.*event]\\[(.*)].* errno 42,.*/\\1/p' " + LOG_FILE;
  EXPECT_EQ(RunCommand(strSed + " | xargs"), "alarm error warn notice info debug debug2 debug3\n");
}

}  // namespace

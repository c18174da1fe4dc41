// The log: its writer, the shared configuration that decides what is written, and its settings.

#include "kidebuglog.h"

#include <sys/resource.h>
#include <sys/shm.h>

#include <set>
#include <thread>

#include "rig.h"
#include "utils.h"

namespace {

using namespace std::string_literals;

constexpr key_t KEY = 0x18180004;
constexpr int COUNT_WORD = 513;  // the place of the process count, counted in 32-bit words

LOG_CATEG Categ(int Value) { return static_cast<LOG_CATEG>(Value); }
LOG_LEVEL Level(int Value) { return static_cast<LOG_LEVEL>(Value); }

void PrintLine(const std::string& strText) {
  KiPrintf(KI_LOG, nullptr, nullptr, "f", 1, "Fn", "%s\n", strText.c_str());
}

class Log : public PrivateVar {};

TEST_F(Log, LineHasEachFieldInItsPlace) {
  char szTime[16];
  const time_t Now = time(nullptr);
  strftime(szTime, sizeof(szTime), "%b %e %R", localtime(&Now));
  std::thread([] { KiPrintf(KI_LOG, "c", "l", "f", 4, "Fn", "thread\n"); }).join();
  EXPECT_EQ(ReadFile(LOG_FILE).substr(0, 12), szTime);
  KiPrintf(KI_LOG, "utils", "error", "a/b\\c.cpp", 7, "Fn", "v=%d %%\n", 5);
  KiPrintf(KI_LOG, "utils", nullptr, "dir/", 2, "Fn", "\n");
  KiPrintf(KI_LOG, nullptr, "error", "/f", 6, "Fn", "cut %ls", L"\u00e9");  // not of this locale
  KiPrintf(NOTIFICATION_LOG, nullptr, nullptr, "f", -1, "Fn", "other\n");
  EXPECT_EQ(LogLines(), (Lines{"[c][l] f:Fn(): thread", "[utils][error] c.cpp:Fn(): v=5 %",
                               ":Fn(): ", "f:Fn(): cut "}));
  const std::string strOther = ReadFile("/var/log/camveld/kinotification.log");
  EXPECT_EQ(strOther.substr(15), " [" + itos(getpid()) + "] f:-1:Fn(): other\n");
  EXPECT_EQ(fs::status(LOG_FILE).permissions() | fs::perms{0022}, fs::perms{0666});
}

TEST_F(Log, LinesOfAnyLengthAreWholeAndErrnoIsTheCallers) {
  const std::string strFormat = "%s%m\n";  // no literal: compilers take %m for an extension
  const rlimit Descriptors = {64, 64};     // too few for one that is left open each time
  setrlimit(RLIMIT_NOFILE, &Descriptors);
  for (size_t Len = 900; Len < 1050; ++Len) {
    const std::string strText(Len, 'x');
    fs::remove(LOG_FILE);
    errno = ENOENT;
    KiPrintf(KI_LOG, nullptr, nullptr, "f", 1, "Fn", strFormat.c_str(), strText.c_str());
    EXPECT_EQ(errno, ENOENT);
    KiDbgPrintf(LOG_CATEG_EVENT, LOG_LEVEL_INFO, "f", 1, "Fn", strFormat.c_str(), strText.c_str());
    EXPECT_EQ(errno, ENOENT);
    const std::string strLine = "f:Fn(): " + strText + strerror(ENOENT);
    ASSERT_EQ(LogLines(), (Lines{strLine, "[event][info] " + strLine}));
  }
}

TEST_F(Log, LostLineGoesToSyslog) {
  const std::regex Reason(R"(.*kidebuglog\.cpp:\d+:KiPrintf\(\): open kilog file (.*)\n?)");
  SyslogSocket Syslog;
  KiPrintf(static_cast<LOG_TYPE>(2), nullptr, nullptr, "f", 1, "Fn", "x\n");
  EXPECT_EQ(std::regex_replace(Syslog.Take(), Reason, "$1"), "failed with errno [22].");
  fs::remove_all("/var/log/camveld");
  errno = EACCES;
  PrintLine("x");
  EXPECT_EQ(errno, EACCES);
  EXPECT_EQ(std::regex_replace(Syslog.Take(), Reason, "$1"), "failed with errno [2].");
  EXPECT_FALSE(fs::exists("/var/log/camveld"));
}

TEST_F(Log, EachCategoryHasItsName) {
  std::set<std::string> Names;
  for (int Value = 0; Value < LOG_CATEG_TOTAL; ++Value) {
    Names.insert(Enum2String(Categ(Value)));
  }
  EXPECT_EQ(Names.size(), static_cast<size_t>(LOG_CATEG_TOTAL));
  EXPECT_EQ(Names.count("unknown"), 0U);
  EXPECT_STREQ(Enum2String(Categ(LOG_CATEG_TOTAL)), "unknown");
  EXPECT_STREQ(Enum2String(Categ(-1)), "unknown");
}

// With a segment made as another program makes it, by its key and size.
class LogConfig : public PrivateVar {
 protected:
  void SetUp() override {
    PrivateVar::SetUp();
    m_Id = shmget(KEY, 2568, IPC_CREAT);
    InitDbgCfg();
    ASSERT_NE(g_pDbgLogCfg, nullptr);
    m_pWords = reinterpret_cast<int32_t*>(g_pDbgLogCfg);
  }
  void TearDown() override {
    FreeDbgCfg();
    shmctl(m_Id, IPC_RMID, nullptr);
    PrivateVar::TearDown();
  }
  int m_Id = -1;
  int32_t* m_pWords = nullptr;
};

TEST_F(LogConfig, IsNotUsedWhereAttachingItIsRefused) {
  if (seteuid(1) != 0) {
    GTEST_SKIP() << "an ordinary user's namespace knows no second user";
  }
  EXPECT_EQ(KiShmDbgLogCfgAt(), nullptr);
  ASSERT_EQ(seteuid(0), 0);
}

TEST_F(LogConfig, GateAsksTheCategoryThenTheProcess) {
  const int Own = getpid();
  const struct {
    int CategLevel;
    int Pid;
    int PidLevel;
    const char* szWritten;
  } rgCase[] = {
      {99, 1, 7, "01234567"}, {3, 1, 7, "0123"},    {-1, 1, 7, "0"},
      {3, Own, 4, "01234"},   {3, Own, -1, "0123"}, {-1, Own, -1, ""},
  };
  for (const auto& Case : rgCase) {
    std::string strWritten;
    g_pDbgLogCfg->SetLogLevel(LOG_CATEG_EVENT, Level(Case.CategLevel));
    g_pDbgLogCfg->SetPidLevel(Case.Pid, Level(Case.PidLevel));
    for (int Value = 0; Value < LOG_LEVEL_TOTAL; ++Value) {
      KIDBGLOG(LOG_CATEG_EVENT, Level(Value), "%s\n", (strWritten += itos(Value)).c_str());
    }
    EXPECT_EQ(strWritten, Case.szWritten) << Case.CategLevel << " " << Case.PidLevel;
  }
  std::string strNames;
  const Lines Log = LogLines();
  for (size_t Value = 0; Value < LOG_LEVEL_TOTAL; ++Value) {
    strNames += Log[Value].substr(0, Log[Value].find(' ')) + "\n";
  }
  EXPECT_EQ(strNames,
            "[event][alarm]\n[event][error]\n[event][warn]\n[event][notice]\n"
            "[event][info]\n[event][debug]\n[event][debug2]\n[event][debug3]\n");
}

TEST_F(LogConfig, MillisecondsFollowTheSwitch) {
  g_pDbgLogCfg->SetLogInMs(true);
  const int64_t usecBefore = GetCurTimestamp();
  PrintLine("x");
  const std::string strTime = ReadFile(LOG_FILE).substr(15, 4);
  EXPECT_EQ(strTime[0], '.');
  const int64_t Passed = std::stoi(strTime.substr(1)) - usecBefore / 1000 % 1000;
  EXPECT_LT((Passed + 1000) % 1000, 500) << strTime;
}

// The process table as "pid=level ...".
std::string Pids() {
  std::string strPids;
  pid_t Pid = 0;
  LOG_LEVEL PidLevel = LOG_LEVEL_ALARM;
  for (int Idx = -1; Idx <= 65; ++Idx) {
    if (g_pDbgLogCfg->GetPidLevel(Idx, Pid, PidLevel) == 0) {
      strPids += itos(Pid) + "=" + itos(PidLevel) + " ";
    }
  }
  return strPids;
}

TEST_F(LogConfig, ProcessTableKeepsItsOrderAndItsBounds) {
  for (int Pid = 101; Pid <= 165; ++Pid) {  // one too many
    g_pDbgLogCfg->SetPidLevel(Pid, LOG_LEVEL_DEBUG);
  }
  EXPECT_EQ(g_pDbgLogCfg->GetPidLevel(165), LOG_LEVEL_ALARM);
  g_pDbgLogCfg->SetPidLevel(164, LOG_LEVEL_ERROR);
  for (int Pid = 103; Pid <= 163; ++Pid) {
    g_pDbgLogCfg->ClearPid(Pid);
  }
  g_pDbgLogCfg->ClearPid(101);
  g_pDbgLogCfg->ClearPid(165);
  EXPECT_EQ(Pids(), "102=5 164=1 ");
  m_pWords[COUNT_WORD] = 65;  // another process may leave any count
  g_pDbgLogCfg->SetPidLevel(7, LOG_LEVEL_INFO);
  EXPECT_EQ(g_pDbgLogCfg->GetPidLevel(7), LOG_LEVEL_ALARM);
  m_pWords[COUNT_WORD] = -1;
  EXPECT_EQ(Pids(), "");
  g_pDbgLogCfg->SetPidLevel(7, LOG_LEVEL_INFO);
  EXPECT_EQ(Pids(), "7=4 ");
}

TEST_F(LogConfig, CategoriesOutOfRangeHaveNoLevel) {
  const int rgLevel[][2] = {{-1, 0}, {0, 256}, {511, 256}, {512, 0}};
  for (const auto& [Value, Expected] : rgLevel) {
    g_pDbgLogCfg->SetLogLevel(Categ(Value), Level(256));
    EXPECT_EQ(g_pDbgLogCfg->GetLogLevel(Categ(Value)), Level(Expected)) << Value;
  }
  EXPECT_EQ(m_pWords[0] | m_pWords[COUNT_WORD], 0);  // the neighbours
}

TEST_F(LogConfig, SettingsOutlastIt) {
  const char* const szFile = "/var/packages/Camveld/etc/settings.conf";
  EXPECT_EQ(g_pDbgLogCfg->LoadDbgLogSettings(), -1);  // there is no directory for them
  EXPECT_EQ(g_pDbgLogCfg->SaveDbgLogSettings(), -1);
  fs::create_directory("/var/packages/Camveld/etc");
  g_pDbgLogCfg->SetLogInMs(true);
  g_pDbgLogCfg->SetPidLevel(7, LOG_LEVEL_INFO);
  g_pDbgLogCfg->Init(0);
  EXPECT_EQ(m_pWords[0] | m_pWords[COUNT_WORD], 0);
  EXPECT_EQ(g_pDbgLogCfg->GetLogLevel(Categ(87)), LOG_LEVEL_NOTICE);
  EXPECT_EQ(g_pDbgLogCfg->GetLogLevel(Categ(88)), LOG_LEVEL_ALARM);

  WriteFile(szFile, "ki_dbglog_settings=x,2,-3,,99\nki_dbglog_time_scale=yes\nzone=x");
  g_pDbgLogCfg->Init(0);
  EXPECT_TRUE(g_pDbgLogCfg->LogInMs());
  EXPECT_EQ(g_pDbgLogCfg->SaveDbgLogSettings(), 0);
  std::string strRest;
  for (int Idx = 4; Idx < LOG_CATEG_TOTAL; ++Idx) {
    strRest += ",3";
  }
  EXPECT_EQ(ReadFile(szFile), "ki_dbglog_settings=\"0,2,-3,99" + strRest +
                                  "\"\nki_dbglog_time_scale=\"yes\"\nzone=\"x\"\n");
  WriteFile(szFile, "ki_dbglog_time_scale=Yes");
  EXPECT_EQ(g_pDbgLogCfg->LoadDbgLogSettings(), 1);
  EXPECT_FALSE(g_pDbgLogCfg->LogInMs());
}

}  // namespace

// The library: key-value files, the log and its configuration, the helpers.

#include <fcntl.h>
#include <pthread.h>
#include <sys/shm.h>

#include <csignal>
#include <future>
#include <memory>
#include <set>
#include <thread>

#include "delaytimer.h"
#include "fileutils.h"
#include "kidebuglog.h"
#include "kiflock.h"
#include "rig.h"
#include "utils.h"

namespace {

using KeyValMap = std::map<std::string, std::string>;
using Numbers = std::vector<int32_t>;

constexpr const char* NAME = "/var/services/camveld/f";

class KeyVal : public PrivateVar {};
class Utils : public PrivateVar {};

// Its configuration lets through what is as severe as an alarm.
class Log : public PrivateVar {
 protected:
  Log() { g_pDbgLogCfg = &m_Cfg; }
  ~Log() override { g_pDbgLogCfg = nullptr; }
  KiDbgLogCfg m_Cfg = {};
};

LOG_CATEG Categ(int Value) { return static_cast<LOG_CATEG>(Value); }
LOG_LEVEL Level(int Value) { return static_cast<LOG_LEVEL>(Value); }

KeyValMap Read(const std::string& strText) {
  KeyValMap KeyVals = {{"old", "old"}};
  WriteFile(NAME, strText);
  KiFileGetAllKeyVals(NAME, KeyVals);
  return KeyVals;
}

TEST_F(KeyVal, LinesCarryPairs) {
  const std::string strLong(5000, 'x');
  EXPECT_EQ(Read("b=1\na=2\nb=3\n"), (KeyValMap{{"a", "2"}, {"b", "1"}}));
  EXPECT_EQ(Read("junk\n\n#a=b\n=x\n"), (KeyValMap{{"#a", "b"}, {"", "x"}}));
  EXPECT_EQ(Read(" a = \"b c\" \nd= e\n"), (KeyValMap{{" a ", "b c"}, {"d", " e"}}));
  EXPECT_EQ(Read("a=x\"b\"c\"y\nd=\"e\n"), (KeyValMap{{"a", "b\"c"}, {"d", "\"e"}}));
  EXPECT_EQ(Read("a=1=2\nb=\"\"\nc=3\r\n"), (KeyValMap{{"a", "1=2"}, {"b", ""}, {"c", "3\r"}}));
  EXPECT_EQ(Read(strLong + "=" + strLong), (KeyValMap{{strLong, strLong}}));
}

TEST_F(KeyVal, ReadingCountsTheLinesOfTheKeys) {
  KeyValMap KeyVals;
  std::string strVal;
  WriteFile(NAME, "a=1\nb=2\na=3\n");
  EXPECT_EQ(KiFileGetKeyVals(NAME, {"a", "c"}, KeyVals), 2);
  EXPECT_EQ(KeyVals, (KeyValMap{{"a", "1"}}));
  EXPECT_EQ(KiFileGetVal(NAME, "b", strVal), 1);
  EXPECT_EQ(strVal, "2");
}

TEST_F(KeyVal, ChangesLeaveSortedPairs) {
  const char* const szText = "#c\nb=\"2\"\n\na=1\nb=3\n";
  WriteFile(NAME, szText);
  EXPECT_EQ(KiFileSetVals(NAME, {}, true), 0);
  EXPECT_EQ(ReadFile(NAME), szText);
  EXPECT_EQ(KiFileSetVals(NAME, {{"b", "x"}, {"", "y"}}, false), 0);
  EXPECT_EQ(ReadFile(NAME), "=y\na=1\nb=x\n");
  EXPECT_EQ(KiFileSetVal(NAME, "c", "a\"b\"c", true), 0);
  EXPECT_EQ(ReadFile(NAME), "=\"y\"\na=\"1\"\nb=\"x\"\nc=\"a\"b\"c\"\n");
  EXPECT_EQ(KiFileRemoveKeys(NAME, {"", "b", "none"}) + KiFileRemoveKey(NAME, "c"), 0);
  EXPECT_EQ(ReadFile(NAME), "a=1\n");
}

TEST_F(KeyVal, ReplacementKeepsOwnerAndModeAndReplacesLinks) {
  WriteFile("/var/target", "a=1\n");
  static_cast<void>(!chown("/var/target", 12, 34));  // an ordinary user may not
  chmod("/var/target", 07652);
  fs::create_symlink("/var/target", NAME);
  EXPECT_EQ(KiFileSetVal(NAME, "b", "2", false), 0);
  EXPECT_EQ(Rights(NAME), Rights("/var/target"));
  EXPECT_EQ(ReadFile(NAME), "a=1\nb=2\n");
  EXPECT_EQ(ReadFile("/var/target"), "a=1\n");
}

TEST_F(KeyVal, NoUpdateIsLost) {
  const auto Write = [](char Start) {
    for (int Key = 0; Key < 200; ++Key) {
      KiFileSetVal(NAME, (Start + std::to_string(Key)).c_str(), "x", false);
    }
  };
  std::thread Other(Write, 'a');
  Write('b');
  Other.join();
  KeyValMap KeyVals;
  EXPECT_EQ(KiFileGetAllKeyVals(NAME, KeyVals), 400);
}

TEST_F(KeyVal, FileThatCannotBeReadWholeIsNotWritten) {
  EXPECT_EQ(KiFileSetVal("/proc/self/mem", "a", "1", false), -1);
  EXPECT_EQ(LogText(),
            "[utils][error] fileutils.cpp:UpdateKeyVals(): Failed to open file "
            "[/proc/self/mem] with errno [5]\n");
}

TEST_F(KeyVal, CancelledThreadFinishesWhatItBegan) {
  const auto Steps = [](void (*pBegin)()) {
    int Done = 0;
    std::thread([&Done, pBegin] {
      pthread_cancel(pthread_self());
      pBegin();
      ++Done;
      pthread_testcancel();  // ends here: cancellation is enabled again
      ++Done;
    }).join();
    return Done;
  };
  EXPECT_EQ(Steps([] { KiPrintf(KI_LOG, nullptr, nullptr, "f", 1, "Fn", "x\n"); }), 1);
  EXPECT_EQ(Steps([] { KiFileSetVal(NAME, "a", "1", false); }), 1);
}

TEST_F(KeyVal, LockExcludesOthersAsLongAsItIsTold) {
  umask(0);
  KiFlock Held(NAME);
  KiFlock Other(NAME);
  EXPECT_EQ(Held.LockSh(0), 0);
  EXPECT_EQ(Other.LockSh(0), 0);
  EXPECT_EQ(Rights(NAME)[0], S_IFREG | 0644U);
  EXPECT_EQ(Held.LockEx(0), -1);
  Other.UnLock();
  EXPECT_EQ(Held.LockEx(0), 0);  // converts the lock it has
  const int64_t usecStart = GetCurTimestamp();
  EXPECT_EQ(Other.LockSh(1), -1);
  EXPECT_EQ(errno, EWOULDBLOCK);
  EXPECT_NEAR(static_cast<double>(GetCurTimestamp() - usecStart), 2e6, 1.1e6);
}

TEST_F(Log, LineHasEachFieldInItsPlace) {
  char szHour[16];
  const time_t Now = time(nullptr);
  strftime(szHour, sizeof(szHour), "%b %e %H", localtime(&Now));
  std::thread([] { KiPrintf(KI_LOG, "c", "l", "f", 4, "Fn", "thread\n"); }).join();
  EXPECT_EQ(ReadFile(LOG_FILE).substr(0, 9), szHour);
  KiPrintf(KI_LOG, "utils", "error", "a/b\\c.cpp", 7, "Fn", "v=%d %%\n", 5);
  KiPrintf(KI_LOG, "utils", nullptr, "dir/", 2, "Fn", "\n");
  KiPrintf(KI_LOG, nullptr, "error", "/f", 6, "Fn", "cut %ls", L"\u00e9");  // not of this locale
  KiPrintf(NOTIFICATION_LOG, nullptr, nullptr, "f", -1, "Fn", "other\n");
  EXPECT_EQ(LogText(),
            "[c][l] f:Fn(): thread\n[utils][error] c.cpp:Fn(): v=5 %\n"
            ":Fn(): \nf:Fn(): cut ");
  const std::string strOther = ReadFile("/var/log/camveld/kinotification.log");
  EXPECT_EQ(strOther.substr(15), " [" + itos(getpid()) + "] f:-1:Fn(): other\n");
  EXPECT_EQ(Rights(LOG_FILE)[0] | 0022, S_IFREG | 0666U);
}

TEST_F(Log, LinesOfAnyLengthAreWholeAndErrnoIsTheCallers) {
  const std::string strFormat = "%s%m\n";  // no literal: compilers take %m for an extension
  for (size_t Len = 900; Len < 1050; ++Len) {
    const std::string strText(Len, 'x');
    fs::remove(LOG_FILE);
    errno = ENOENT;
    KiDbgPrintf(LOG_CATEG_EVENT, LOG_LEVEL_INFO, "f", 1, "Fn", strFormat.c_str(), strText.c_str());
    EXPECT_EQ(errno, ENOENT);
    ASSERT_EQ(LogText(), "[event][info] f:Fn(): " + strText + strerror(ENOENT) + "\n");
  }
}

TEST_F(Log, MillisecondsAreThoseOfTheClock) {
  m_Cfg.SetLogInMs(true);
  const int64_t Before = GetCurTimestamp() / 1000;
  KiPrintf(KI_LOG, nullptr, nullptr, "f", 1, "Fn", "x\n");
  const int64_t After = GetCurTimestamp() / 1000;
  EXPECT_EQ(LogText(), "f:Fn(): x\n");
  const int Written = std::stoi(ReadFile(LOG_FILE).substr(16, 3));
  EXPECT_LE((Written + 1000 - Before % 1000) % 1000, After - Before);
}

TEST_F(Log, CategoriesAndLevelsHaveTheirNames) {
  std::set<std::string> Categs = {"unknown"};
  for (int Value = 0; Value < LOG_CATEG_TOTAL; ++Value) {
    EXPECT_TRUE(Categs.insert(Enum2String(Categ(Value))).second) << Value;
  }
  EXPECT_STREQ(Enum2String(Categ(-1)), "unknown");
  const char* rgName[] = {"alarm", "error", "warn", "notice", "info", "debug", "debug2", "debug3"};
  for (int Value = 0; Value < LOG_LEVEL_TOTAL; ++Value) {
    EXPECT_STREQ(Enum2String(Level(Value)), rgName[Value]);
  }
}

TEST_F(Log, ConfigurationOfAnotherUserIsNotUsed) {
  const int Id = shmget(0x18180004, sizeof(m_Cfg), IPC_CREAT | 0600);
  EXPECT_NE(KiShmDbgLogCfgAt(), nullptr);
  if (seteuid(1) == 0) {  // an ordinary user's namespace knows no second user
    EXPECT_EQ(KiShmDbgLogCfgAt(), nullptr);
    ASSERT_EQ(seteuid(0), 0);
  }
  shmctl(Id, IPC_RMID, nullptr);
}

TEST_F(Log, GateAsksTheCategoryThenTheProcess) {
  const auto Written = [this](int CategLevel, int Pid, int PidLevel) {
    std::string strWritten;
    m_Cfg.SetLogLevel(LOG_CATEG_EVENT, Level(CategLevel));
    m_Cfg.SetPidLevel(Pid, Level(PidLevel));
    for (int Value = 0; Value < LOG_LEVEL_TOTAL; ++Value) {
      KIDBGLOG(LOG_CATEG_EVENT, Level(Value), "%s\n", (strWritten += itos(Value)).c_str());
    }
    return strWritten;
  };
  EXPECT_EQ(Written(3, 1, 7), "0123");
  EXPECT_EQ(Written(3, getpid(), 4), "01234");
  EXPECT_EQ(Written(-1, getpid(), -1), "");
}

TEST_F(Log, ConfigurationKeepsItsLayoutAndItsBounds) {
  auto* const pWords = reinterpret_cast<int32_t*>(&m_Cfg);
  pid_t Pid = 0;
  LOG_LEVEL PidLevel = LOG_LEVEL_ALARM;
  for (int Value = 101; Value <= 165; ++Value) {  // one too many
    m_Cfg.SetPidLevel(Value, LOG_LEVEL_DEBUG);
  }
  m_Cfg.SetPidLevel(164, LOG_LEVEL_ERROR);
  for (int Value = 103; Value <= 163; ++Value) {
    m_Cfg.ClearPid(Value);
  }
  m_Cfg.ClearPid(101);
  for (const int Value : {-1, 0, 511, 512}) {
    m_Cfg.SetLogLevel(Categ(Value), Level(256 + Value));
  }
  EXPECT_EQ(Numbers(pWords, pWords + 2), (Numbers{0, 256}));
  EXPECT_EQ(Numbers(pWords + 512, pWords + 518), (Numbers{767, 2, 102, 5, 164, 1}));
  EXPECT_EQ(m_Cfg.GetPidLevel(1, Pid, PidLevel), 0);
  EXPECT_EQ(m_Cfg.GetPidLevel(2, Pid, PidLevel), -1);
  EXPECT_EQ(Pid, 164);
}

TEST_F(Log, SettingsOutlastTheConfiguration) {
  const char* const szFile = "/var/packages/Camveld/etc/settings.conf";
  WriteFile(szFile, "ki_dbglog_settings=x,2,-3,,99\nki_dbglog_time_scale=yes\nzone=x");
  m_Cfg.SetPidLevel(7, LOG_LEVEL_INFO);
  m_Cfg.Init(0);
  EXPECT_EQ(m_Cfg.GetPidLevel(7), LOG_LEVEL_ALARM);
  EXPECT_EQ(m_Cfg.SaveDbgLogSettings(), 0);
  const std::regex Saved(
      "ki_dbglog_settings=\"0,2,-3,99(,3){84}\"\nki_dbglog_time_scale=\"yes\"\nzone=\"x\"\n");
  EXPECT_TRUE(std::regex_match(ReadFile(szFile), Saved)) << ReadFile(szFile);
}

std::string Base64(const char* szText) {
  const std::unique_ptr<char, decltype(&free)> pText(HttpBase64Encode(szText), free);
  return pText.get();
}

TEST_F(Utils, Texts) {
  EXPECT_EQ(GetBaseName("a/b\\c"), "c");
  EXPECT_EQ(urlEncoding("Az09_~()*,-. \t/\xfe", ""), "Az09_~()*,-.%20%20%2F%FE");
  EXPECT_EQ(urlEncoding("a/b+c \xfe", "/\xfe"), "a/b%2Bc%20\xfe");
  EXPECT_EQ(Trim(" -a b- ", "- "), "a b");
  EXPECT_EQ(Trim("--", "-"), "");
  std::string strText = "ab-ababa-aba";
  ReplaceSubstr(strText, "", "x");
  ReplaceSubstr(strText, "aba", "xaba");
  EXPECT_EQ(strText, "ab-xababa-xaba");
  StringEraseCharacter(strText, '-');
  EXPECT_EQ(strText, "abxababaxaba");
  EXPECT_EQ(Base64("f") + Base64("fo"), "Zg==Zm8=");
  EXPECT_EQ(Base64("\xff\xef\xbe>?~"), "/+++Pj9+");
  const unsigned char rgHash[16] = {0x00, 0x1f, 0xa0, 0xff};
  EXPECT_EQ(UnsignedHashToStr(rgHash), "001fa0ff000000000000000000000000");
  char szCopy[] = "12345";
  EXPECT_STREQ(Strncpy(szCopy, "abcd", 3), "ab");
}

TEST_F(Utils, Numbers) {
  EXPECT_EQ(Hex2Dec("09afAF", 6), 0x09afaf);
  EXPECT_EQ(Hex2Dec("a0g1", 4), 0xa0);
  EXPECT_EQ(Hex2Dec("1FFFFFFFE5", 9), -2);
  EXPECT_EQ(String2IntVector("1;;x, -7,012x,+3;", ",;"), (Numbers{1, 0, -7, 12, 3}));
  EXPECT_EQ(String2IntVector("4294967296,-2147483649", ","), (Numbers{INT32_MAX, INT32_MIN}));
}

TEST_F(Utils, Times) {
  EXPECT_EQ(GetTimeDiffUSec({10, 900000}, {12, 100000}), 1200000);
  EXPECT_EQ(GetAbsTimeDiffUSec({12, 100000}, {10, 900000}), 1200000);
  EXPECT_EQ(GetAbsTimeDiffBySec(5, 8), 3.0);
  EXPECT_EQ(GetISO8601TimeText(4102444800007999), "21000101T000000.007Z");
}

// The milliseconds that a tick takes.
int64_t Tick(DelayTimer* pTimer) {
  const int64_t usecStart = GetCurTimestamp();
  pTimer->Delay();
  return (GetCurTimestamp() - usecStart) / 1000;
}

TEST_F(Utils, TimerCountsFromTheTickPlannedUnlessItIsPastOrToCome) {
  static DelayTimer Timer(400000);
  static int64_t Within = -1;
  signal(SIGALRM, [](int) { Within = Tick(&Timer); });  // as if the clock had been set back
  ualarm(100000, 0);
  EXPECT_GE(Tick(&Timer), 390);
  EXPECT_LT(Within, 200);
  Timer.SetDelayTime(1000000);
  EXPECT_NEAR(static_cast<double>(Tick(&Timer)), 700, 250);
  usleep(1010000);
  EXPECT_LT(Tick(&Timer), 300);
  EXPECT_GE(Tick(&Timer), 500);
}

TEST_F(Utils, WriteFdGoesOnAfterSignalsAndFullPipes) {
  constexpr int32_t LEN = 1 << 18;
  const std::string strText(LEN, 'x');
  struct sigaction Interrupt = {};  // without SA_RESTART
  Interrupt.sa_handler = [](int) {};
  sigaction(SIGALRM, &Interrupt, nullptr);
  for (const int Flags : {0, O_NONBLOCK}) {
    int rgFd[2];
    ASSERT_EQ(pipe2(rgFd, Flags), 0);
    std::future<std::string> Read = std::async(std::launch::async, [&rgFd] {
      usleep(50000);
      return ReadFile("/dev/fd/" + itos(rgFd[0]));
    });
    ualarm(10000, 10000);  // the second one finds a call that has written nothing
    EXPECT_EQ(WriteFd(rgFd[1], strText.data(), LEN), LEN);
    ualarm(0, 0);
    close(rgFd[1]);
    EXPECT_TRUE(Read.get() == strText);
    close(rgFd[0]);
  }
  EXPECT_EQ(WriteFd(-1, "x", 1), 0);
}

TEST_F(Utils, ThreadIsDetachedIfAskedFor) {
  pthread_t Thread;
  const ThreadFunc pWait = [](void* pParam) -> void* {
    pause();
    return pParam;
  };
  ASSERT_TRUE(CreateThread(pWait, nullptr, 0, true, Thread));
  EXPECT_EQ(pthread_detach(Thread), EINVAL);
}

}  // namespace

// The library: key-value files, the log and its configuration, the helpers.

#include <fcntl.h>
#include <pthread.h>
#include <sys/shm.h>

#include <atomic>
#include <csignal>
#include <memory>
#include <set>
#include <thread>

#include "delaytimer.h"
#include "fileops.h"
#include "fileutils.h"
#include "kidebuglog.h"
#include "kiflock.h"
#include "rig.h"
#include "utils.h"

namespace {

using KeyValMap = std::map<std::string, std::string>;
using Numbers = std::vector<int32_t>;

constexpr const char* NAME = "/var/services/camveld/f";

constexpr time_t SEC_EAST = 50400;  // 14 hours, so that local time is never UTC
[[maybe_unused]] const int TZ_SET = setenv("TZ", "EAST-14", 1);

class KeyVal : public PrivateVar {};

// Its configuration lets through what is as severe as an alarm.
class Log : public PrivateVar {
 protected:
  Log() { g_pDbgLogCfg = &m_Cfg; }
  ~Log() override { g_pDbgLogCfg = nullptr; }
  KiDbgLogCfg m_Cfg = {};
};

LOG_CATEG Categ(int Value) { return static_cast<LOG_CATEG>(Value); }
LOG_LEVEL Level(int Value) { return static_cast<LOG_LEVEL>(Value); }

// Lets SIGALRM interrupt system calls.
void Interrupt() {
  struct sigaction Action = {};  // without SA_RESTART
  Action.sa_handler = [](int) {};
  sigaction(SIGALRM, &Action, nullptr);
}

KeyValMap Read(const std::string& strText) {
  KeyValMap KeyVals = {{"old", "old"}};
  WriteFile(NAME, strText);
  KiFileGetAllKeyVals(NAME, KeyVals);
  return KeyVals;
}

TEST_F(KeyVal, LinesCarryPairs) {
  std::string strVal;
  EXPECT_EQ(Read("b=1\na=2\nb=3\n"), (KeyValMap{{"a", "2"}, {"b", "1"}}));
  EXPECT_EQ(KiFileGetVal(NAME, "b", strVal), 2);  // lines
  EXPECT_EQ(strVal, "1");
  EXPECT_EQ(Read("junk\n\n#a=b\n=x\n"), (KeyValMap{{"#a", "b"}, {"", "x"}}));
  EXPECT_EQ(Read(" a = \"b c\" \nd= e\n"), (KeyValMap{{" a ", "b c"}, {"d", " e"}}));
  EXPECT_EQ(Read("a=x\"b\"c\"y\nd=\"e\n"), (KeyValMap{{"a", "b\"c"}, {"d", "\"e"}}));
  EXPECT_EQ(Read("a=1=2\nb=\"\"\nc=3\r"), (KeyValMap{{"a", "1=2"}, {"b", ""}, {"c", "3\r"}}));
}

TEST_F(KeyVal, ChangesLeaveSortedPairs) {
  WriteFile(NAME, "#c\nb=\"2\"\n\na=1\nb=3\n");
  static_cast<void>(!chown(NAME, 12, 34));  // an ordinary user may not
  chmod(NAME, 07652);
  const auto Before = Rights(NAME);
  EXPECT_EQ(KiFileSetVals(NAME, {{"b", "x"}, {"", "y"}}, false), 0);
  EXPECT_EQ(ReadFile(NAME), "=y\na=1\nb=x\n");
  for (int Time = 0; Time < 50; ++Time) {  // more often than there are descriptors
    EXPECT_EQ(KiFileSetVal(NAME, "c", "a\"b\"c", true), 0);
  }
  EXPECT_EQ(ReadFile(NAME), "=\"y\"\na=\"1\"\nb=\"x\"\nc=\"a\"b\"c\"\n");
  EXPECT_EQ(KiFileRemoveKeys(NAME, {"", "b", "none"}), 0);
  EXPECT_EQ(KiFileRemoveKey(NAME, "c"), 0);
  EXPECT_EQ(ReadFile(NAME), "a=1\n");
  EXPECT_EQ(Rights(NAME), Before);
}

TEST_F(KeyVal, ChangeIsOfTheFileThatIsThereWhenItsTurnComes) {
  const char* const szNew = "/var/services/camveld/new";
  KiFlock Old(NAME);
  KiFlock New(szNew);
  EXPECT_EQ(Old.LockEx(0), 0);
  EXPECT_EQ(New.LockSh(0), 0);
  WriteFile(szNew, "a=1\n");
  std::string strVal;
  std::thread Reader([&strVal] { KiFileGetVal(NAME, "a", strVal); });
  std::thread Change([] { KiFileSetVal(NAME, "a", "2", false); });
  Interrupt();
  usleep(100000);
  pthread_kill(Reader.native_handle(), SIGALRM);
  pthread_kill(Change.native_handle(), SIGALRM);
  fs::rename(szNew, NAME);
  Old.UnLock();
  Reader.join();
  EXPECT_EQ(strVal, "1");
  usleep(100000);
  EXPECT_EQ(ReadFile(NAME), "a=1\n");
  New.UnLock();
  Change.join();
  EXPECT_EQ(ReadFile(NAME), "a=2\n");
}

TEST_F(KeyVal, ChangeFollowsNoLinkInPlaceOfItsTemporaryFile) {
  const char* const szVictim = "/var/victim";
  WriteFile(szVictim, "victim\n");
  chmod(szVictim, 0600);
  const auto Before = Rights(szVictim);
  WriteFile(NAME, "");
  static_cast<void>(!chown(NAME, 12, 34));
  std::atomic<bool> blStop = false;
  std::thread Attacker([&blStop, szVictim] {
    std::error_code Error;  // another thread removes what the directory lists
    while (!blStop) {
      for (const auto& Entry : fs::directory_iterator("/var/services/camveld", Error)) {
        if (Entry.path() != NAME && fs::remove(Entry, Error)) {
          fs::create_symlink(szVictim, Entry, Error);
        }
      }
    }
  });
  for (int Change = 0; Change < 3000; ++Change) {
    KiFileSetVal(NAME, "a", "1", false);
  }
  blStop = true;
  Attacker.join();
  EXPECT_EQ(KiFileSetVal(NAME, "a", "2", false), 0);
  EXPECT_EQ(ReadFile(NAME), "a=2\n");
  EXPECT_EQ(ReadFile(szVictim), "victim\n");
  EXPECT_EQ(Rights(szVictim), Before);
}

TEST_F(KeyVal, CancelledThreadFinishesWhatItBegan) {
  const auto Steps = [](void (*pBegin)()) {
    int Done = 0;
    std::thread([&Done, pBegin] {
      KiFlock Lock("/var/lock");
      Lock.LockEx(0);
      pthread_cancel(pthread_self());
      pBegin();
      Lock.UnLock();
      ++Done;
      pthread_testcancel();  // ends here: cancellation is enabled again
      ++Done;
    }).join();
    return Done;
  };
  EXPECT_EQ(Steps([] { KiPrintf(KI_LOG, nullptr, nullptr, "f", 1, "Fn", "x\n"); }), 1);
  EXPECT_EQ(Steps([] { KiFileSetVal(NAME, "a", "1", false); }), 1);
  EXPECT_EQ(Steps([] { const fileops::Descriptor Fd(dup(0)); }), 1);
}

TEST_F(KeyVal, CancelledReaderLeavesNothingOpen) {
  WriteFile(NAME, "a=1\n");
  const auto NextFree = [] {  // a reader opens two: for the lock, and for reading
    const fileops::Descriptor First(dup(0));
    const fileops::Descriptor Second(dup(0));
    return Numbers{First.Get(), Second.Get()};
  };
  const Numbers Before = NextFree();
  for (int Time = 0; Time < 200; ++Time) {
    std::thread Reader([] {
      std::string strVal;
      while (KiFileGetVal(NAME, "a", strVal) == 1) {
      }
    });
    usleep(1000);
    pthread_cancel(Reader.native_handle());
    Reader.join();
    ASSERT_EQ(NextFree(), Before);
  }
}

TEST_F(KeyVal, LockExcludesOthersAsLongAsItIsTold) {
  KiFlock Held(NAME);
  KiFlock Other(NAME);
  EXPECT_EQ(Held.LockSh(0), 0);
  EXPECT_EQ(Other.LockSh(0), 0);
  EXPECT_EQ(Rights(NAME)[0], S_IFREG | 0644U);
  EXPECT_EQ(Held.LockEx(0), -1);
  Other.UnLock();
  EXPECT_EQ(Held.LockEx(0), 0);  // converts the lock it has
  EXPECT_NE(system("ls -l /proc/self/fd | grep -q camveld/f"), 0) << "inherited";
  Interrupt();
  const int64_t usecStart = GetCurTimestamp();
  ualarm(10000, 10000);
  EXPECT_EQ(Other.LockSh(1), -1);
  EXPECT_EQ(errno, EWOULDBLOCK);
  ualarm(0, 0);
  EXPECT_NEAR(static_cast<double>(GetCurTimestamp() - usecStart), 2e6, 1.1e6);
}

TEST_F(Log, LineHasEachFieldInItsPlace) {
  KiPrintf(KI_LOG, "utils", "error", "a/b\\c.cpp", 7, "Fn", "v=%d %%\n", 5);
  KiPrintf(NOTIFICATION_LOG, nullptr, "error", "f", 1, "Fn", "other\n");
  EXPECT_EQ(LogText(), "[utils][error] c.cpp:Fn(): v=5 %\n");
  const LogLine Other = LogLines("/var/log/camveld/kinotification.log").at(0);
  tm Local = {};
  const time_t Now = time(nullptr) + SEC_EAST;
  gmtime_r(&Now, &Local);  // for the year
  strptime(Other.strTime.c_str(), "%b %e %T", &Local);
  EXPECT_NEAR(static_cast<double>(timegm(&Local) - Now), 0, 60);
  EXPECT_EQ(Other.strProcess, "[" + itos(getpid()) + "]");
  EXPECT_EQ(Other.strRest, "f:Fn(): other");
  EXPECT_EQ(Rights(LOG_FILE)[0], S_IFREG | 0666U);
}

TEST_F(Log, LinesOfAnyLengthAreWholeAndErrnoIsTheCallers) {
  const char* szFormat = "%s %m\n";  // no literal: -Wpedantic refuses %m
  for (size_t Len = 900; Len < 1050; ++Len) {
    const std::string strText(Len, 'x');
    fs::remove(LOG_FILE);
    errno = EBUSY;
    KiDbgPrintf(LOG_CATEG_EVENT, LOG_LEVEL_INFO, "f", 1, "Fn", szFormat, strText.c_str());
    ASSERT_EQ(LogText(), "[event][info] f:Fn(): " + strText + " Device or resource busy\n");
  }
  fs::remove_all("/var/log");
  errno = EBUSY;
  KiPrintf(KI_LOG, nullptr, nullptr, "f", 1, "Fn", "lost\n");
  EXPECT_EQ(errno, EBUSY);
}

TEST_F(Log, EachCategoryHasANameOfItsOwn) {
  std::set<std::string> Names = {"unknown"};
  for (int Value = 0; Value < LOG_CATEG_TOTAL; ++Value) {
    EXPECT_TRUE(Names.insert(Enum2String(Categ(Value))).second) << Value;
  }
  EXPECT_STREQ(Enum2String(Categ(-1)), "unknown");
}

TEST_F(Log, ConfigurationOfAnotherUserIsNotUsed) {
  const int Id = shmget(KiShmDbgLogIPCKey(), sizeof(m_Cfg), IPC_CREAT | 0600);
  const bool blOtherUser = seteuid(1) == 0;
  if (blOtherUser) {
    EXPECT_EQ(KiShmDbgLogCfgAt(), nullptr);
    EXPECT_EQ(seteuid(0), 0);
  }
  shmctl(Id, IPC_RMID, nullptr);
  if (!blOtherUser) {
    GTEST_SKIP() << "an ordinary user's namespace knows no second user";
  }
}

TEST_F(Log, ConfigurationKeepsItsLayoutAndItsBounds) {
  // Other programs find these words here: the time scale, the levels of 512 categories, the number
  // of processes, and two words for each process.
  constexpr size_t LastLevel = 512;
  constexpr size_t PidCount = LastLevel + 1;
  constexpr size_t FirstPid = PidCount + 1;
  auto* const pWords = reinterpret_cast<int32_t*>(&m_Cfg);
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
  EXPECT_EQ(pWords[LastLevel], 767);
  EXPECT_EQ(Numbers(pWords + PidCount, pWords + FirstPid + 4), (Numbers{2, 102, 5, 164, 1}));
  pWords[PidCount] = INT32_MAX;  // another program may store any count
  EXPECT_EQ(m_Cfg.GetPidLevel(166), LOG_LEVEL_ALARM);
  m_Cfg.Init(0);
  EXPECT_EQ(Numbers(pWords + PidCount, pWords + FirstPid + 2), (Numbers{0, 0, 0}));
}

std::string Base64(const char* szText) {
  const std::unique_ptr<char, decltype(&free)> pText(HttpBase64Encode(szText), free);
  return pText.get();
}

TEST(Utils, Texts) {
  EXPECT_EQ(urlEncoding("Az09_~()*,-. \t/\xfe+\xef", "/\xfe"), "Az09_~()*,-.%20%20/\xfe%2B%EF");
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

TEST(Utils, Numbers) {
  EXPECT_EQ(GetISO8601TimeText(1700000000123999), "20231114T221320.123Z");
  EXPECT_EQ(Hex2Dec("09afAF", 6), 0x09afaf);
  EXPECT_EQ(Hex2Dec("a0g1", 4), 0xa0);
  EXPECT_EQ(String2IntVector("1;;x, -7,012x,+3;", ",;"), (Numbers{1, 0, -7, 12, 3}));
  EXPECT_EQ(String2IntVector("4294967296,-2147483649", ","), (Numbers{INT32_MAX, INT32_MIN}));
}

// Stores the calling thread's detach state in the atomic int at pState.
void* StoreDetachState(void* pState) {
  pthread_attr_t Attr;
  int State = -1;
  pthread_getattr_np(pthread_self(), &Attr);
  pthread_attr_getdetachstate(&Attr, &State);
  pthread_attr_destroy(&Attr);
  *static_cast<std::atomic<int>*>(pState) = State;
  return nullptr;
}

TEST(Utils, ThreadIsDetachedOrNot) {
  for (const int Expected : {PTHREAD_CREATE_JOINABLE, PTHREAD_CREATE_DETACHED}) {
    static std::atomic<int> State;
    State = -1;
    const bool blDetach = Expected == PTHREAD_CREATE_DETACHED;
    pthread_t Id;
    ASSERT_TRUE(CreateThread(StoreDetachState, &State, 0, blDetach, Id));
    while (State == -1) {
      usleep(1000);
    }
    EXPECT_EQ(State, Expected);
    if (!blDetach) {
      pthread_join(Id, nullptr);
    }
  }
}

// The milliseconds that a tick takes.
int64_t Tick(DelayTimer* pTimer) {
  const int64_t usecStart = GetCurTimestamp();
  pTimer->Delay();
  return (GetCurTimestamp() - usecStart) / 1000;
}

TEST(Utils, TimerKeepsItsPace) {
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

int32_t WriteAll(int Fd, const void* pBuf, int32_t Len) {
  return fileops::WriteAll(Fd, pBuf, static_cast<size_t>(Len)) == 0 ? Len : -1;
}

TEST(Utils, WritingGoesOnAfterSignalsAndFullPipes) {
  const std::string strText = ReadFile("/proc/self/exe").substr(0, 1 << 18);
  const auto Len = static_cast<int32_t>(strText.size());
  ASSERT_EQ(Len, 1 << 18);
  Interrupt();
  for (const auto& [Flags, pWrite] :
       {std::pair(0, &WriteFd), std::pair(O_NONBLOCK, &WriteFd), std::pair(0, &WriteAll)}) {
    int rgFd[2];
    ASSERT_EQ(pipe2(rgFd, Flags), 0);
    std::thread Reader([&rgFd, &strText] {
      usleep(50000);
      EXPECT_TRUE(ReadFile("/dev/fd/" + itos(rgFd[0])) == strText);
    });
    ualarm(10000, 10000);  // the second one finds a call that has written nothing
    EXPECT_EQ(pWrite(rgFd[1], strText.data(), Len), Len);
    ualarm(0, 0);
    close(rgFd[1]);
    Reader.join();
    close(rgFd[0]);
  }
  EXPECT_EQ(WriteFd(-1, "x", 1), 0);
}

}  // namespace

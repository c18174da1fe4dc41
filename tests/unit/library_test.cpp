// The library: key-value files, the log, the helpers.

#include <pthread.h>

#include <csignal>
#include <memory>
#include <thread>

#include "fileops.h"
#include "fileutils.h"
#include "kidebuglog.h"
#include "kiflock.h"
#include "rig.h"
#include "utils.h"

namespace {

using Numbers = std::vector<int32_t>;

constexpr const char* NAME = "/var/services/camveld/f";

constexpr time_t SEC_EAST = 50400;  // 14 hours, so that local time is never UTC
[[maybe_unused]] const int TZ_SET = setenv("TZ", "EAST-14", 1);

class KeyVal : public PrivateVar {};
class Log : public PrivateVar {};

// Lets SIGALRM interrupt system calls, and sends it every usec microseconds; 0 stops that.
void Interrupt(useconds_t usec) {
  struct sigaction Action = {};  // without SA_RESTART
  Action.sa_handler = [](int) {};
  sigaction(SIGALRM, &Action, nullptr);
  ualarm(usec, usec);
}

TEST_F(KeyVal, ChangesLeaveSortedPairs) {
  const struct {
    const char* szBefore;
    const char* szAfter;  // a key was removed
  } rgCase[] = {
      {"b=1\na=2\nb=3\nk=4\n", "a=2\nb=1\n"},  // the first of two counts
      {"junk\n\n#a=b\n=x\n", "=x\n#a=b\n"},
      {" a = \"b c\" \nd= e\n", " a =b c\nd= e\n"},  // quotes end the value
      {"a=x\"b\"c\"y\nd=\"e\n", "a=b\"c\nd=\"e\n"},
      {"a=1=2\nb=\"\"\nc=3\r", "a=1=2\nb=\nc=3\r\n"},
  };
  for (const auto& Case : rgCase) {
    WriteFile(NAME, Case.szBefore);
    EXPECT_EQ(KiFileRemoveKey(NAME, "k"), 0);
    EXPECT_EQ(ReadFile(NAME), Case.szAfter);
  }
  EXPECT_EQ(KiFileSetVals(NAME, {{"", "y"}, {"c", "a\"b\"c"}}, true), 0);
  EXPECT_EQ(KiFileRemoveKeys(NAME, {"b", "none"}), 0);
  EXPECT_EQ(ReadFile(NAME), "=y\na=1=2\nc=a\"b\"c\n");
}

TEST_F(KeyVal, NoChangeIsLostBesideOthers) {
  constexpr unsigned Changes = 100;
  std::vector<std::thread> Threads;
  WriteFile(NAME, "");
  for (const char* szKey : {"a", "b", "c", "d"}) {
    Threads.emplace_back([szKey] {
      std::string strVal;
      for (unsigned Change = 0; Change < Changes; ++Change) {
        const std::string strKey = szKey + itos(Change);
        EXPECT_EQ(KiFileSetVal(NAME, strKey.c_str(), "1", true), 0);
        EXPECT_EQ(KiFileGetVal(NAME, strKey.c_str(), strVal), 1) << strKey;
      }
    });
  }
  for (std::thread& Thread : Threads) {
    Thread.join();
  }
  std::map<std::string, std::string> KeyVals = {{"old", "old"}};
  EXPECT_EQ(KiFileGetAllKeyVals(NAME, KeyVals), 4 * Changes);  // lines
  EXPECT_EQ(KeyVals.size(), 4 * Changes);
}

TEST_F(KeyVal, CancelledThreadFinishesWhatItBegan) {
  WriteFile(NAME, "a=1\n");
  const auto Steps = [](const auto& Begin) {
    int Done = 0;
    std::thread([&Done, &Begin] {
      pthread_cancel(pthread_self());
      Begin();
      ++Done;
      pthread_testcancel();  // ends here: cancellation is enabled again
      ++Done;
    }).join();
    return Done;
  };
  EXPECT_EQ(Steps([] { KiPrintf(KI_LOG, nullptr, nullptr, "f", 1, "Fn", "x\n"); }), 1);
  EXPECT_EQ(Steps([] { KiFileSetVal(NAME, "a", "1", false); }), 1);
  EXPECT_EQ(Steps([] { KiFlock("/var/lock").LockEx(0); }), 1);
  EXPECT_EQ(Steps([] { const fileops::Descriptor Fd(dup(0)); }), 1);
}

TEST_F(KeyVal, LockExcludesOthersAsLongAsItIsTold) {
  KiFlock Held(NAME);
  KiFlock Other(NAME);
  EXPECT_EQ(Held.LockSh(0), 0);
  EXPECT_EQ(Other.LockSh(0), 0);
  EXPECT_EQ(fs::status(NAME).permissions(), fs::perms(0644));
  EXPECT_EQ(Held.LockEx(0), -1);
  Other.UnLock();
  EXPECT_EQ(Held.LockEx(0), 0);  // converts the lock it has
  const int64_t usecStart = GetCurTimestamp();
  Interrupt(10000);
  EXPECT_EQ(Other.LockSh(1), -1);
  EXPECT_EQ(errno, EWOULDBLOCK);
  Interrupt(0);
  EXPECT_NEAR(static_cast<double>(GetCurTimestamp() - usecStart), 2e6, 1.1e6);
}

TEST_F(Log, LineHasEachFieldInItsPlace) {
  const char* const szFile = "/var/log/camveld/kinotification.log";
  KiPrintf(NOTIFICATION_LOG, "utils", "error", "a/b\\c.cpp", 7, "Fn", "v=%d %%\n", 5);
  const std::string strLine = ReadFile(szFile);
  const time_t Now = time(nullptr) + SEC_EAST;
  tm Local = {};
  gmtime_r(&Now, &Local);  // for the year
  const char* const szRest = strptime(strLine.c_str(), "%b %e %T", &Local);
  ASSERT_NE(szRest, nullptr) << strLine;
  EXPECT_NEAR(static_cast<double>(timegm(&Local) - Now), 0, 60) << strLine;
  EXPECT_EQ(szRest, " [" + itos(getpid()) + "][utils][error] c.cpp:7:Fn(): v=5 %\n");
  EXPECT_EQ(fs::status(szFile).permissions(), fs::perms(0666));
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

TEST(Utils, TextsAndNumbers) {
  EXPECT_EQ(urlEncoding("Az09_~()*,-. \t/\xfe+\xef", "/\xfe"), "Az09_~()*,-.%20%20/\xfe%2B%EF");
  EXPECT_EQ(Trim(" -a b- ", "- ") + Trim("--", "-"), "a b");
  std::string strText = "ab-ababa-aba";
  ReplaceSubstr(strText, "", "x");
  ReplaceSubstr(strText, "aba", "xaba");
  EXPECT_EQ(strText, "ab-xababa-xaba");
  for (const auto& [szText, szBase64] :
       {std::pair("\xff\xef\xbe>?~", "/+++Pj9+"), {"f", "Zg=="}, {"fo", "Zm8="}}) {
    const std::unique_ptr<char, decltype(&free)> pBase64(HttpBase64Encode(szText), free);
    EXPECT_STREQ(pBase64.get(), szBase64);
  }
  const unsigned char rgHash[16] = {0x00, 0x1f, 0xa0, 0xff};
  EXPECT_EQ(UnsignedHashToStr(rgHash), "001fa0ff000000000000000000000000");
  char szCopy[] = "12345";
  EXPECT_STREQ(Strncpy(szCopy, "abcd", 3), "ab");
  EXPECT_EQ(GetISO8601TimeText(1700000000123999), "20231114T221320.123Z");
  EXPECT_EQ(Hex2Dec("a0Fg1", 5), 0xa0f);
  EXPECT_EQ(String2IntVector("1;;x, -7,012x,+3;", ",;"), (Numbers{1, 0, -7, 12, 3}));
  EXPECT_EQ(String2IntVector("4294967296,-2147483649", ","), (Numbers{INT32_MAX, INT32_MIN}));
}

TEST(Utils, ThreadIsDetachedOrNot) {
  for (const int Expected : {PTHREAD_CREATE_JOINABLE, PTHREAD_CREATE_DETACHED}) {
    const auto Sleep = [](void*) -> void* {
      sleep(1);
      return nullptr;
    };
    pthread_t Id;
    ASSERT_TRUE(CreateThread(Sleep, nullptr, 0, Expected == PTHREAD_CREATE_DETACHED, Id));
    pthread_attr_t Attr;
    int State = -1;
    pthread_getattr_np(Id, &Attr);
    pthread_attr_getdetachstate(&Attr, &State);
    pthread_attr_destroy(&Attr);
    EXPECT_EQ(State, Expected);
    if (State == PTHREAD_CREATE_JOINABLE) {
      pthread_join(Id, nullptr);
    }
  }
}

}  // namespace

// The helpers for texts and times, the delay timer, the descriptor writer, the thread launcher.

#include "utils.h"

#include <fcntl.h>

#include <csignal>
#include <memory>
#include <thread>

#include "delaytimer.h"
#include "rig.h"

namespace {

using namespace std::string_literals;
using Numbers = std::vector<int32_t>;

class Utils : public PrivateVar {};

std::string Replaced(std::string strText, const char* szSub, const char* szReplace) {
  ReplaceSubstr(strText, szSub, szReplace);
  return strText;
}

std::string Base64(const char* szText) {
  const std::unique_ptr<char, decltype(&free)> pText(HttpBase64Encode(szText), free);
  return pText.get();
}

TEST_F(Utils, Texts) {
  EXPECT_EQ(GetBaseName("a/b\\c"), "c");
  EXPECT_EQ(GetBaseName("a\\b/c"), "c");
  EXPECT_EQ(GetBaseName("dir/"), "");
  EXPECT_EQ(GetBaseName("name"), "name");
  EXPECT_EQ(urlEncoding("Az09_~()*,-. \t\r/\xfe\0"s, ""), "Az09_~()*,-.%20%20%20%2F%FE%00");
  EXPECT_EQ(urlEncoding("a/b+c \xfe", "/\xfe"), "a/b%2Bc%20\xfe");
  EXPECT_EQ(Trim(" -a b- ", "- "), "a b");
  EXPECT_EQ(Trim("--", "-"), "");
  EXPECT_EQ(Trim(" a ", nullptr), " a ");
  EXPECT_EQ(Replaced("ab-ababa-aba", "aba", "xaba"), "ab-xababa-xaba");
  EXPECT_EQ(Replaced("aaa", "", "x"), "aaa");
  std::string strErased = "-a--b-";
  StringEraseCharacter(strErased, '-');
  EXPECT_EQ(strErased, "ab");
  EXPECT_EQ(Base64("") + Base64("f") + Base64("fo"), "Zg==Zm8=");
  EXPECT_EQ(Base64("\xff\xef\xbe>?~"), "/+++Pj9+");
  const unsigned char rgHash[16] = {0x00, 0x1f, 0xa0, 0xff};
  EXPECT_EQ(UnsignedHashToStr(rgHash), "001fa0ff000000000000000000000000");
  char szCopy[] = "12345";
  EXPECT_STREQ(Strncpy(szCopy, "abcd", 3), "ab");
  EXPECT_STREQ(Strncpy(szCopy, "x", 0), "ab");
  Strncpy(szCopy, "x", 5);
  EXPECT_EQ(std::string(szCopy, 5), "x\0\0\0\0"s);
}

TEST_F(Utils, Numbers) {
  EXPECT_EQ(Hex2Dec("1fF91", 5), 0x1ff91);
  EXPECT_EQ(Hex2Dec("a0g1", 4), 0xa0);
  EXPECT_EQ(Hex2Dec("12345", 3), 0x123);
  EXPECT_EQ(Hex2Dec("1FFFFFFFE", 9), -2);
  EXPECT_EQ(String2IntVector("1;;x, -7,012x,+3;", ",;"), (Numbers{1, 0, -7, 12, 3}));
  EXPECT_EQ(String2IntVector("4294967296,-2147483649", ","), (Numbers{INT32_MAX, INT32_MIN}));
  EXPECT_EQ(String2IntVector("12", ""), Numbers{});
}

TEST_F(Utils, Times) {
  EXPECT_EQ(GetTimeDiffUSec({10, 900000}, {12, 100000}), 1200000);
  EXPECT_EQ(GetAbsTimeDiffUSec({12, 100000}, {10, 900000}), 1200000);
  EXPECT_EQ(GetAbsTimeDiffBySec(5, 8), 3.0);
  EXPECT_EQ(GetISO8601TimeText(4102444800007999), "21000101T000000.007Z");
  EXPECT_EQ(GetISO8601TimeText(-1500000), "19691231T235959.-500Z");
  EXPECT_NEAR(static_cast<double>(GetCurTimestamp()), 1e6 * static_cast<double>(time(nullptr)),
              2e6);
}

// The milliseconds that a tick takes.
int64_t Tick(DelayTimer* pTimer) {
  const int64_t usecStart = GetCurTimestamp();
  pTimer->Delay();
  return (GetCurTimestamp() - usecStart) / 1000;
}

TEST_F(Utils, TimerCountsFromThePlannedTickUnlessItIsPast) {
  DelayTimer Timer(20000);
  signal(SIGALRM, [](int) { usleep(300000); });
  ualarm(10000, 0);
  EXPECT_GE(Tick(&Timer), 300);  // the signal makes it late
  Timer.SetDelayTime(1000000);
  EXPECT_NEAR(static_cast<double>(Tick(&Timer)), 700, 250);
  Timer.SetDelayTime(300000);
  usleep(310000);
  EXPECT_LT(Tick(&Timer), 150);
  EXPECT_GE(Tick(&Timer), 150);
}

TEST_F(Utils, TimerDoesNotWaitForAClockThatWasSetBack) {
  static DelayTimer Timer(400000);
  static int64_t Within = -1;
  signal(SIGALRM, [](int) { Within = Tick(&Timer); });  // its last tick is yet to come
  ualarm(10000, 0);
  EXPECT_GE(Tick(&Timer), 390);
  EXPECT_LT(Within, 200);
}

TEST_F(Utils, WriteFdGoesOnAfterSignalsAndFullPipes) {
  const std::string strText(1 << 18, 'x');
  const auto Len = static_cast<int32_t>(strText.size());
  struct sigaction Interrupt = {};  // without SA_RESTART
  Interrupt.sa_handler = [](int) {};
  sigaction(SIGALRM, &Interrupt, nullptr);
  for (const int Flags : {0, O_NONBLOCK}) {
    int rgFd[2];
    ASSERT_EQ(pipe2(rgFd, Flags), 0);
    fcntl(rgFd[0], F_SETFL, 0);
    std::string strRead(strText.size(), ' ');
    std::thread Reader([&] {
      usleep(50000);
      size_t Done = 0;
      ssize_t Got = 1;
      while (Got != 0) {
        Got = read(rgFd[0], &strRead[Done], strRead.size() - Done);
        Done += static_cast<size_t>(std::max<ssize_t>(Got, 0));
      }
    });
    ualarm(10000, 10000);  // the second one finds a call that has written nothing
    EXPECT_EQ(WriteFd(rgFd[1], strText.data(), Len), Len);
    ualarm(0, 0);
    close(rgFd[1]);
    Reader.join();
    EXPECT_TRUE(strRead == strText);
    close(rgFd[0]);
  }
  EXPECT_EQ(WriteFd(-1, "x", 1) + WriteFd(-1, "x", -5), 0);
  EXPECT_EQ(LogLines(), Lines{"[utils][notice] utils.cpp:WriteFd(): Write fd[-1] error[9]"});
}

TEST_F(Utils, ThreadHasTheStackAndStateAskedFor) {
  static int rgHold[2];  // a pipe: the threads wait until it is closed
  ASSERT_EQ(pipe(rgHold), 0);
  const ThreadFunc pWait = [](void* pParam) -> void* {
    char Byte;
    return read(rgHold[0], &Byte, 1) == 0 ? pParam : nullptr;
  };
  pthread_t Detached;
  pthread_t Joinable;
  pthread_attr_t Attr;
  size_t Size = 0;
  int State = -1;
  void* pReturned = nullptr;
  ASSERT_TRUE(CreateThread(pWait, nullptr, 16 << 20, true, Detached));
  ASSERT_TRUE(CreateThread(pWait, &Size, 1, false, Joinable));  // no stack is that small
  pthread_getattr_np(Detached, &Attr);
  pthread_attr_getstacksize(&Attr, &Size);
  pthread_attr_getdetachstate(&Attr, &State);
  pthread_attr_destroy(&Attr);
  EXPECT_EQ(Size, 16U << 20);
  EXPECT_EQ(State, PTHREAD_CREATE_DETACHED);
  close(rgHold[1]);
  EXPECT_EQ(pthread_join(Joinable, &pReturned), 0);
  EXPECT_EQ(pReturned, &Size);
}

}  // namespace

// The helpers for times, the delay timer, the descriptor writer and the thread launcher. The
// helpers for texts have a fuzzer.

#include "utils.h"

#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <mutex>
#include <sstream>

#include "delaytimer.h"
#include "rig.h"

// In the place of libc's: the clock moves in sleeps only, which signals interrupt and which end 1
// ms late; a write takes as many bytes as the next of gWrites says, or fails with that negative
// errno, until all are used.
static int64_t gClock = 1000980000;
static std::istringstream gWrites;
static string gTaken;

int gettimeofday(timeval* ptvNow, void* /*pZone*/) noexcept {
  *ptvNow = {gClock / 1000000, gClock % 1000000};
  return 0;
}

int nanosleep(const timespec* pTime, timespec* pLeft) {
  const long usec = (pTime->tv_nsec + 1000) / 2000;
  pLeft->tv_nsec = pTime->tv_nsec - usec * 1000;
  gClock += pLeft->tv_nsec == 0 ? usec + 1000 : usec;
  errno = EINTR;
  return pLeft->tv_nsec == 0 ? 0 : -1;
}

ssize_t write(int Fd, const void* pBuf, size_t Len) {
  int Ret = 0;
  if (!(gWrites >> Ret)) {
    return syscall(SYS_write, Fd, pBuf, Len);
  }
  errno = -Ret;
  Ret = std::clamp(Ret, -1, static_cast<int>(Len));
  gTaken.append(static_cast<const char*>(pBuf), Ret < 0 ? 0 : static_cast<size_t>(Ret));
  return Ret;
}

namespace {

class Utils : public Appliance {};

TEST_F(Utils, TimesAtTheirLimits) {
  EXPECT_EQ(GetAbsTimeDiffUSec({12, 100000}, {10, 900000}), 1200000);
  GetAbsTimeDiffUSec({INT64_MIN, 0}, {int64_t{1} << 57, 0});  // to overflow in each step
  EXPECT_EQ(GetAbsTimeDiffBySec(5, 8), 3.0);
  EXPECT_EQ(GetCurTimestamp(), gClock);
  EXPECT_EQ(GetISO8601TimeText(4102444800007999), "21000101T000000.007Z");
  EXPECT_EQ(GetISO8601TimeText(-1500000), "19691231T235959.-500Z");
}

TEST_F(Utils, TimerCountsFromThePlannedTickUnlessItIsPastOrTheClockWentBack) {
  DelayTimer Timer(30000);
  // In milliseconds: what passes before a call, the interval, and what passes in the call.
  const int rgStep[][3] = {{25, 30, 6},    {19, 30, 11}, {34, 30, 0}, {5, 30, 26},
                           {-2126, 30, 0}, {25, 40, 16}, {29, -1, 0}};
  for (const auto& [Before, Interval, Within] : rgStep) {
    const int64_t usecCalled = gClock += int64_t{Before} * 1000;
    Timer.SetDelayTime(Interval * 1000);
    Timer.Delay();
    EXPECT_EQ(gClock - usecCalled, Within * 1000);
  }
}

TEST_F(Utils, WriteFdGivesUpOnErrorsAndEmptyWritesOnly) {
  const int64_t usecStart = gClock;
  gWrites = std::istringstream("3 0 0 -4 3 0 0 0 -11 0   1 0 0 0 0 0 99   4");  // EINTR, EAGAIN
  EXPECT_EQ(WriteFd(-1, "0123456789", 10), 6);
  const unsigned char rgBytes[] = "abcdefghij";
  EXPECT_EQ(WriteFd(-1, rgBytes, 10), 10);
  EXPECT_EQ(WriteFd(-1, "0123456789", 10) + WriteFd(-1, "0123456789", -5), 4);
  EXPECT_EQ(gTaken, "012345abcdefghij0123");
  EXPECT_EQ(gClock, usecStart + 21000);
  EXPECT_EQ(LogLines(), Lines({"[utils][notice] utils.cpp:WriteFd(): Write fd[-1] error[9]"}));
}

TEST_F(Utils, ThreadIsAsAskedFor) {
  static std::mutex Hold;
  const ThreadFunc pFunc = [](void* pParam) -> void* {
    static_cast<std::mutex*>(pParam)->lock();  // never returns
    return nullptr;
  };
  size_t Size = 0;
  pthread_t Thread;
  pthread_attr_t Attr;
  Hold.lock();
  EXPECT_TRUE(CreateThread(pFunc, &Hold, 16 << 20, true, Thread));
  EXPECT_EQ(pthread_detach(Thread), EINVAL);
  pthread_getattr_np(Thread, &Attr);
  pthread_attr_getstacksize(&Attr, &Size);
  pthread_attr_destroy(&Attr);
  EXPECT_EQ(Size >> 20, 16u);
  EXPECT_TRUE(CreateThread(pFunc, &Hold, 1, false, Thread));  // no stack is that small
  EXPECT_EQ(pthread_detach(Thread), 0);
  RunCommand("prlimit -p $PPID -v$(($(cut -d' ' -f1 /proc/$PPID/statm) * 4096 + (1 << 30))):");
  EXPECT_FALSE(CreateThread(pFunc, &Hold, 0xfffff000, true, Thread));  // no room for 4 GiB
  EXPECT_EQ(LogLines().at(0), "[utils][error] utils.cpp:CreateThread(): Failed to create thread.");
}

}  // namespace

// The lock on a file.

#include "kiflock.h"

#include <pthread.h>
#include <sys/stat.h>

#include <atomic>
#include <thread>

#include "rig.h"
#include "utils.h"

namespace {

class Flock : public PrivateVar {};

TEST_F(Flock, ExcludesOthersAsLongAsItIsTold) {
  umask(0);
  KiFlock Held("/var/file");
  KiFlock Other("/var/file");
  EXPECT_EQ(Held.LockSh(0) + Other.LockSh(0), 0);  // readers go together
  EXPECT_EQ(fs::status("/var/file").permissions(), fs::perms{0644});
  EXPECT_EQ(Held.LockEx(0), -1);
  EXPECT_EQ(errno, EWOULDBLOCK);
  Other.UnLock();
  EXPECT_EQ(Held.LockEx(0), 0);  // converts the lock it has
  const int64_t usecStart = GetCurTimestamp();
  EXPECT_EQ(Other.LockSh(1), -1);
  EXPECT_EQ(errno, EWOULDBLOCK);
  EXPECT_NEAR(static_cast<double>(GetCurTimestamp() - usecStart), 2e6, 1.1e6);
  Held.UnLock();
  EXPECT_EQ(Other.LockEx(-1), 0);
  KiFlock Missing("/var/missing/file");
  EXPECT_EQ(Missing.LockEx(-1), -1);
  EXPECT_EQ(errno, ENOENT);
}

TEST_F(Flock, CancelledWaiterReleasesTheLockBeforeItEnds) {
  for (int Round = 0; Round < 100; ++Round) {
    KiFlock Held("/var/file");
    ASSERT_EQ(Held.LockEx(0), 0) << "round " << Round;
    std::atomic<int> Steps = 0;
    std::thread Waiter([&Steps] {
      {
        KiFlock Lock("/var/file");
        Lock.LockEx(0);  // opens the file, which is a cancellation point
        ++Steps;
        Lock.LockEx(-1);
      }
      ++Steps;
      pthread_testcancel();
      ++Steps;
    });
    while (Steps == 0) {
      usleep(100);
    }
    pthread_cancel(Waiter.native_handle());
    Held.UnLock();
    Waiter.join();
    ASSERT_EQ(Steps, 2) << "round " << Round;
  }
}

}  // namespace

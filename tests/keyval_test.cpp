// Key-value files.

#include <pthread.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>

#include "fileutils.h"
#include "kidebuglog.h"
#include "kiflock.h"
#include "rig.h"
#include "utils.h"

namespace {

using KEY_VAL_MAP = std::map<string, string>;

constexpr const char* NAME = "/var/services/camveld/f";

class KeyVal : public Appliance {};

// What a shell command prints in the directory of the file, f.
string Shell(const string& strCommand) {
  return RunCommand("cd /var/services/camveld; " + strCommand).strOutput;
}

TEST_F(KeyVal, ReadSelected) {
  KEY_VAL_MAP KeyVals = {{"old", "old"}};
  string strVal = "old";
  umask(027);
  EXPECT_EQ(KiFileGetVal(NAME, "a", strVal), 0);
  EXPECT_EQ(strVal + Shell("stat -c '%a %s' f"), "640 0\n");
  const string strLong(1 << 20, 'x');
  WriteFile(NAME, strLong + "=" + strLong + "\na=1\nb=2\na=3\nc=4=5");
  EXPECT_EQ(KiFileGetVal(NAME, strLong.c_str(), strVal), 1);
  EXPECT_TRUE(strVal == strLong);
  EXPECT_EQ(KiFileGetKeyVals(NAME, {}, KeyVals) + KiFileGetKeyVals(NAME, {"x", ""}, KeyVals), 0);
  EXPECT_EQ(KiFileGetKeyVals(NAME, {"a", "c", "x"}, KeyVals), 3);
  EXPECT_EQ(KiFileGetVal(NAME, "a", strVal), 2);
  EXPECT_EQ(strVal, "1");
  EXPECT_EQ(KeyVals, (KEY_VAL_MAP{{"a", "1"}, {"c", "4=5"}}));
  EXPECT_EQ(KiFileGetAllKeyVals("/var/missing/f", KeyVals), -1);
  EXPECT_EQ(KeyVals, KEY_VAL_MAP());
}

TEST_F(KeyVal, ReplacementKeepsModeAndReplacesLinks) {
  WriteFile(string(NAME) + ".tmp.abcdef", "left behind");
  for (const string strMode : {"7777", "6640", "400"}) {
    Shell("echo a=1 >/var/target; chmod " + strMode + " /var/target; ln -sf /var/target f");
    EXPECT_EQ(KiFileSetVal(NAME, "b", "2", false), 0);
    EXPECT_EQ(Shell("stat -c '%a %F' f; cat f /var/target f.tmp.*"),
              strMode + " regular file\na=1\nb=2\na=1\nleft behind");
  }
  EXPECT_EQ(Shell("stat -c '%a %s' " + CreateTmpFile(NAME) + "; ls | grep -Exc 'f\\.tmp\\.\\w{6}'"),
            "600 0\n2\n");
}

// Provokes the failures of a table in the client: it must fail with just these log lines, and leave
// the file, unless that was removed, and nothing else behind.
void Provoke(const string& strTable) {
  const string strContent = "a=1\n" + string(8000, '#');
  for (const Lines& Row : ReadTable(strTable)) {
    Shell(string("rm -f f ") + LOG_FILE);
    WriteFile(NAME, strContent);
    EXPECT_EQ(RunProgram(TESSEL_CLIENT, Row[2], Row[1]).Status, 1) << Row[0];
    EXPECT_EQ(Shell("sed -E 's/^[^]]*]//; s/:[0-9]+:/:/; s/tmp\\.\\w{6}/tmp.XXXXXX/' " +
                    string(LOG_FILE) + "; ls; cat f 2>/dev/null; umount -l f $PWD 2>/dev/null"),
              Row[0] + (Row[1].find("rm ") == string::npos ? "\nf\n" + strContent : "\n"));
  }
}

TEST_F(KeyVal, FailingStepsAreLogged) { Provoke("keyfailures.tsv"); }

TEST_F(KeyVal, OwnerAndGroupStayOrTheUpdateFails) {
  if (RunCommand(string("install -o 1234 -g 5678 -m 6755 /dev/null ") + NAME).Status != 0) {
    GTEST_SKIP() << "no other user is mapped into this user namespace: run as root";
  }
  EXPECT_EQ(KiFileSetVal(NAME, "a", "1", false), 0);
  EXPECT_EQ(Shell("stat -c '%u %g %a %s' f"), "1234 5678 6755 4\n");
  Provoke("keyowners.tsv");
}

TEST_F(KeyVal, NoUpdateIsLostAndNoReaderSeesHalfAFile) {
  RunCommand("prlimit -p $PPID -n64");  // too few for one that is left open each time
  EXPECT_EQ(KiFileSetVal(NAME, "z", "end", false), 0);
  for (int Writer = 0; Writer < 8; ++Writer) {
    if (fork() == 0) {
      for (int Key = 0; Key < 500; ++Key) {
        KiFileSetVal(NAME, itos(500 * Writer + Key).c_str(), "x", false);
      }
      _exit(0);
    }
  }
  KEY_VAL_MAP KeyVals;
  for (int Before = 1; waitpid(-1, nullptr, WNOHANG) != -1;) {
    for (int Read = 0; Read < 50; ++Read) {
      const string strUnlocked = "\n" + ReadFile(NAME);
      ASSERT_EQ(strUnlocked.find("\nz=end\n") + 7, strUnlocked.size());
    }
    const int Match = KiFileGetAllKeyVals(NAME, KeyVals);
    ASSERT_GE(Match, Before);
    Before = Match;
  }
  EXPECT_EQ(Shell("ls; cut -d= -f1 f | sort -u | wc -l"), "f\n4001\n");
}

// Cancels a thread while it waits for the lock of szFile, and then lets it go on.
void CancelWaiting(const char* szFile, void (*pAction)()) {
  KiFlock Held(szFile);
  ASSERT_EQ(Held.LockEx(0), 0);
  std::atomic<int> Steps = 0;
  std::thread Thread([&] {
    pAction();
    ++Steps;
    pthread_testcancel();  // ends here: cancellation is enabled again
    ++Steps;
  });
  usleep(200000);
  EXPECT_EQ(Steps, 0);
  pthread_cancel(Thread.native_handle());
  Held.UnLock();
  Thread.join();
  EXPECT_EQ(Steps, 1);
  EXPECT_EQ(KiFlock(szFile).LockEx(0), 0);
}

TEST_F(KeyVal, CancelledThreadFinishesWhatItBegan) {
  WriteFile(NAME, "a=1\n");
  CancelWaiting(NAME, [] { EXPECT_EQ(KiFileSetVal(NAME, "b", "2", false), 0); });
  // Logging the failure does not enable cancellation before the lock is released.
  Shell("mount --bind f f");
  CancelWaiting(NAME, [] { EXPECT_EQ(KiFileSetVal(NAME, "c", "3", false), -1); });
  EXPECT_EQ(Shell("ls; cat f; umount f"), "f\na=1\nb=2\n");
  CancelWaiting(LOG_FILE.c_str(), [] { KiPrintf(KI_LOG, nullptr, nullptr, "f", 1, "Fn", "x\n"); });
  EXPECT_EQ(LogLines().size(), 2u);
}

}  // namespace

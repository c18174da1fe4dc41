// Key-value files: what the slow version of inputs_test does not show.

#include <pthread.h>
#include <unistd.h>

#include <future>

#include "fileutils.h"
#include "kidebuglog.h"
#include "kiflock.h"
#include "rig.h"

namespace {

constexpr const char* NAME = "/var/services/camveld/f";

class KeyVal : public Appliance {};

// What a shell command prints in the directory of the file, f.
string Shell(const string& strCommand) {
  return RunCommand("cd /var/services/camveld; " + strCommand);
}

TEST_F(KeyVal, ReadSelected) {
  const string strLong(1 << 16, 'x');
  std::map<string, string> KeyVals;
  string strVal = "old";
  EXPECT_EQ(KiFileGetVal(NAME, "a", strVal), 0);
  EXPECT_EQ(strVal + Shell("stat -c %s f"), "0\n");
  WriteFile(NAME, strLong + "=" + strLong + "\na=1\nb=2\na=3\nc=4=5");
  EXPECT_EQ(KiFileGetVal(NAME, "a", strVal), 2);
  EXPECT_EQ(strVal, "1");
  EXPECT_EQ(KiFileGetKeyVals(NAME, {"a", "c", "x", strLong}, KeyVals), 4);
  EXPECT_EQ(KeyVals, (decltype(KeyVals){{"a", "1"}, {"c", "4=5"}, {strLong, strLong}}));
  EXPECT_EQ(KiFileGetKeyVals(NAME, {}, KeyVals), 0);
  EXPECT_TRUE(KeyVals.empty());
}

TEST_F(KeyVal, ReplacementKeepsOwnerAndModeAndReplacesLinks) {
  // An ordinary user's namespace knows no second owner.
  const string strStat = "stat -Lc '%a %u %g' f; cat /var/target f.tmp.*; ";
  Shell(
      "echo a=1 | tee /var/target >f.tmp.abcdef; ln -s /var/target f; chown 12:34 f; chmod 7652 f");
  const string strBefore = Shell(strStat);
  EXPECT_EQ(KiFileSetVals(NAME, {{"b", "2"}}, false), 0);
  EXPECT_EQ(Shell(strStat + "readlink f; cat f"), strBefore + "a=1\nb=2\n");
  EXPECT_EQ(Shell("stat -c '%a %s' " + CreateTmpFile(NAME) + "; ls | grep -Exc 'f\\.tmp\\.\\w{6}'"),
            "600 0\n2\n");
}

// The client must fail with just these log lines, and leave the file, where it is named behind
// them, and nothing else.
TEST_F(KeyVal, FailingStepsAreLogged) {
  const string strShow = "sed -E 's/^[^]]*]//; s/:[0-9]+:/:/; s/tmp\\.\\w{6}/tmp.XXXXXX/' " +
                         LOG_FILE + "; ls; exec 2>&-; cmp f /var/before; umount -l f $PWD";
  for (const Lines& Row : ReadTable("keyfailures.tsv")) {
    Shell("{ echo a=1; printf %08000d; } | tee f >/var/before; rm -f " + LOG_FILE);
    const string strRun = Row[1] + " $P " + Row[2] + "; echo it ended with $?";
    EXPECT_NE(RunCommand(strRun).find("it ended with 1\n"), string::npos) << Row[0];
    EXPECT_EQ(Shell(strShow), Row[0] + "\n");
  }
}

TEST_F(KeyVal, NoUpdateIsLostAndNoReaderSeesHalfAFile) {
  RunCommand("prlimit -p $PPID -n64");  // too few for one that is left open each time
  KiFileSetVal(NAME, "z", "end", false);
  std::future<void> Writers[8];
  for (int Writer = 0; Writer < 8; ++Writer) {
    Writers[Writer] = std::async(std::launch::async, [Writer] {
      for (int Key = 0; Key < 250; ++Key) {
        KiFileSetVal(NAME, std::to_string(250 * Writer + Key).c_str(), "x", false);
      }
    });
  }
  for (const std::future<void>& Writer : Writers) {
    while (Writer.wait_for(std::chrono::seconds(0)) != std::future_status::ready) {
      const string strUnlocked = "\n" + ReadFile(NAME);
      ASSERT_EQ(strUnlocked.find("\nz=end\n") + 7, strUnlocked.size());
    }
  }
  EXPECT_EQ(Shell("ls; cut -d= -f1 f | sort -u | wc -l"), "f\n2001\n");
}

// Also where it logs a failure, which does not enable cancellation before the lock is released.
TEST_F(KeyVal, CancelledThreadFinishesWhatItBegan) {
  Shell("touch f; mount --bind f f");  // cannot be replaced
  for (const string& strHeld : {LOG_FILE, string(NAME)}) {
    KiFlock Held(strHeld);
    int Steps = 0;
    EXPECT_EQ(Held.LockEx(0), 0);
    std::thread Thread([&] {
      KiPrintf(KI_LOG, nullptr, nullptr, "f", 1, "Fn", "x\n");
      KiFileSetVal(NAME, "a", "1", false);
      ++Steps;
      pthread_testcancel();  // ends here: cancellation is enabled again
      ++Steps;
    });
    usleep(200000);
    pthread_cancel(Thread.native_handle());
    Held.UnLock();
    Thread.join();
    EXPECT_EQ(Steps, 1);
  }
  EXPECT_EQ(KiFlock(NAME).LockEx(0) + KiFlock(LOG_FILE).LockEx(0), 0);
  EXPECT_EQ(Shell("ls; umount f"), "f\n");
  EXPECT_EQ(LogLines().size(), 4u);
}

}  // namespace

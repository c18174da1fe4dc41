// Key-value files.

#include "fileutils.h"

#include <pthread.h>
#include <sys/resource.h>
#include <sys/stat.h>

#include <atomic>
#include <thread>

#include "kidebuglog.h"
#include "kiflock.h"
#include "rig.h"

namespace {

using namespace std::string_literals;
using KeyValMap = std::map<std::string, std::string>;

constexpr const char* NAME = "/var/services/camveld/f";

class KeyVal : public PrivateVar {
 protected:
  // Nothing is left beside the file.
  void TearDown() override {
    EXPECT_EQ(std::distance(fs::directory_iterator("/var/services/camveld"), {}), 1);
    PrivateVar::TearDown();
  }
};

TEST_F(KeyVal, LinesCarryPairs) {
  const std::string strLong(1 << 16, 'x');
  const struct {
    std::string strText;
    int Lines;
    KeyValMap KeyVals;
  } rgCase[] = {
      {"a=1\nb=2", 2, {{"a", "1"}, {"b", "2"}}},
      {"a=1\na=2\nb=\na=3\n", 4, {{"a", "1"}, {"b", ""}}},
      {"junk\n\n#a=b\n=x\n", 2, {{"#a", "b"}, {"", "x"}}},
      {" a = \"b c\" \nd= e\n", 2, {{" a ", "b c"}, {"d", " e"}}},
      {"a=x\"b\"c\"y\nd=\"e\nf=\"\"\n", 3, {{"a", "b\"c"}, {"d", "\"e"}, {"f", ""}}},
      {"a=1=2\nb=3\r\nc=\"4\"\r\n", 3, {{"a", "1=2"}, {"b", "3\r"}, {"c", "4"}}},
      {"a=1\0002\n\0=\xff\n"s, 2, {{"a", "1\0002"s}, {"\0"s, "\xff"}}},
      {strLong + "=" + strLong, 1, {{strLong, strLong}}},
  };
  KeyValMap KeyVals = {{"old", "old"}};
  EXPECT_EQ(KiFileGetAllKeyVals(NAME, KeyVals), 0);
  EXPECT_EQ(KeyVals, KeyValMap{});
  for (const auto& Case : rgCase) {
    WriteFile(NAME, Case.strText);
    EXPECT_EQ(KiFileGetAllKeyVals(NAME, KeyVals), Case.Lines) << Case.strText;
    EXPECT_EQ(KeyVals, Case.KeyVals);
  }
}

TEST_F(KeyVal, ChangesLeaveSortedPairs) {
  const char* const szText = "#c\nb=\"2\"\n\na=1\nb=3\n";
  EXPECT_EQ(KiFileSetVal(NAME, "n", "new", true), 0);
  EXPECT_EQ(ReadFile(NAME), "n=\"new\"\n");
  WriteFile(NAME, szText);
  EXPECT_EQ(KiFileSetVals(NAME, {}, true) + KiFileRemoveKeys(NAME, {}), 0);
  EXPECT_EQ(ReadFile(NAME), szText);
  EXPECT_EQ(KiFileSetVals(NAME, {{"b", "x"}, {"", "y"}}, false), 0);
  EXPECT_EQ(ReadFile(NAME), "=y\na=1\nb=x\n");
  EXPECT_EQ(KiFileSetVal(NAME, "c", "a\"b\"c", true), 0);
  EXPECT_EQ(ReadFile(NAME), "=\"y\"\na=\"1\"\nb=\"x\"\nc=\"a\"b\"c\"\n");
  EXPECT_EQ(KiFileRemoveKeys(NAME, {"", "b", "none"}) + KiFileRemoveKey(NAME, "c"), 0);
  EXPECT_EQ(ReadFile(NAME), "a=1\n");
}

TEST_F(KeyVal, ReplacementKeepsOwnerAndModeAndReplacesLinks) {
  struct stat Before;
  struct stat After;
  WriteFile("/var/target", "a=1\n");
  static_cast<void>(!chown("/var/target", 12, 34));  // an ordinary user may not
  chmod("/var/target", 07652);
  stat("/var/target", &Before);
  fs::create_symlink("/var/target", NAME);
  EXPECT_EQ(KiFileSetVal(NAME, "b", "2", false), 0);
  lstat(NAME, &After);
  EXPECT_EQ(After.st_mode, Before.st_mode);
  EXPECT_EQ(After.st_uid, Before.st_uid);
  EXPECT_EQ(After.st_gid, Before.st_gid);
  EXPECT_EQ(ReadFile(NAME), "a=1\nb=2\n");
  EXPECT_EQ(ReadFile("/var/target"), "a=1\n");
}

TEST_F(KeyVal, NoUpdateIsLostAndNoReaderSeesHalfAFile) {
  const rlimit Descriptors = {64, 64};  // too few for one that is left open each time
  setrlimit(RLIMIT_NOFILE, &Descriptors);
  KiFileSetVal(NAME, "z", "end", false);
  std::atomic<int> Running = 8;
  std::thread rgWriter[8];
  for (int Writer = 0; Writer < 8; ++Writer) {
    rgWriter[Writer] = std::thread([Writer, &Running] {
      for (int Key = 0; Key < 50; ++Key) {
        KiFileSetVal(NAME, std::to_string(50 * Writer + Key).c_str(), "x", false);
      }
      --Running;
    });
  }
  int Cut = 0;
  while (Running > 0) {
    const std::string strText = "\n" + ReadFile(NAME);
    Cut += strText.size() < 7 || strText.substr(strText.size() - 7) != "\nz=end\n" ? 1 : 0;
  }
  for (std::thread& Writer : rgWriter) {
    Writer.join();
  }
  KeyValMap KeyVals;
  EXPECT_EQ(KiFileGetAllKeyVals(NAME, KeyVals), 401);
  EXPECT_EQ(Cut, 0) << "readings did not end with the last key";
}

// Also when it logs a failure, which must not enable cancellation before the lock is released.
TEST_F(KeyVal, CancelledThreadFinishesWhatItBegan) {
  WriteFile(NAME, "");
  ASSERT_EQ(mount(NAME, NAME, nullptr, MS_BIND, nullptr), 0);  // cannot be replaced
  for (const char* szHeld : {LOG_FILE, NAME}) {
    KiFlock Held(szHeld);
    ASSERT_EQ(Held.LockEx(0), 0);
    std::atomic<int> Steps = 0;
    std::thread Thread([&Steps, szHeld] {
      if (szHeld == LOG_FILE) {
        KiPrintf(KI_LOG, nullptr, nullptr, "f", 1, "Fn", "x\n");
      } else {
        KiFileSetVal(NAME, "a", "1", false);
      }
      ++Steps;
      pthread_testcancel();  // ends here: cancellation is enabled again
      ++Steps;
    });
    usleep(200000);
    pthread_cancel(Thread.native_handle());
    Held.UnLock();
    Thread.join();
    EXPECT_EQ(Steps, 1) << szHeld;
    EXPECT_EQ(KiFlock(NAME).LockEx(0) + KiFlock(LOG_FILE).LockEx(0), 0);
  }
  umount2(NAME, MNT_DETACH);
  EXPECT_EQ(LogLines().size(), 2U);
}

}  // namespace

// Capability files.

#include "zamoc.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <chrono>
#include <future>

#include "kiflock.h"
#include "rig.h"

namespace {

using namespace std::string_literals;

constexpr const char* FILE_NAME = "/var/services/camveld/file";
constexpr const char* LEFT_BEHIND = "/var/services/camveld/.zamoc.tmp";

class CapabilityFile : public PrivateVar {};

// The value of k with its whole length.
std::string Get(const char* szFile) {
  char szValue[8] = "old";
  const int Len = ZAMOCFileGetKeyValue(szFile, "k", szValue, sizeof(szValue), 0);
  return std::to_string(Len) + " " + szValue;
}

int Set(const char* szFile, const char* szValue) {
  return ZAMOCFileSetKeyValue(szFile, "k", szValue, "%s= %s\n");
}

TEST_F(CapabilityFile, LinesAreReadAndChanged) {
  const std::string strOthers = "#k=1\nK=2\nkk=3\nx=k\n=k\nk\n\r\n \n";
  const struct {
    std::string strText;
    std::string strGot;
    std::string strSet;      // the text after k was set
    std::string strRemoved;  // the text after k was taken out
  } rgCase[] = {
      {"", "0 ", "k= new\n", ""},
      {"a=1", "0 ", "a=1\nk= new\n", "a=1"},
      {strOthers, "0 ", strOthers + "k= new\n", strOthers},
      {"a=1\nk=2\nb=3\nk=4\n\n k\t=5", "1 2", "a=1\nk= new\nb=3\n\n", "a=1\nb=3\n\n"},
      {" k\t=\t v= w \t\r\nb=3", "4 v= w", "k= new\nb=3", "b=3"},
      {"k = \"a \"\r\n", "2 a ", "k= new\n", ""},
      {"k=\"\"a\"\"", "3 \"a\"", "k= new\n", ""},
      {"k=\"a\nk=b\n", "2 \"a", "k= new\n", ""},
      {"k=\"\n", "1 \"", "k= new\n", ""},
      {"a=\0\nk=12345678\n"s, "8 1234567", "a=\0\nk= new\n"s, "a=\0\n"s},
  };
  for (const auto& Case : rgCase) {
    WriteFile(FILE_NAME, Case.strText);
    EXPECT_EQ(Get(FILE_NAME), Case.strGot) << Case.strText;
    EXPECT_EQ(Set(FILE_NAME, "new"), 0);
    EXPECT_EQ(ReadFile(FILE_NAME), Case.strSet);
    WriteFile(FILE_NAME, Case.strText);
    EXPECT_EQ(ZAMOCFileRemoveKey(FILE_NAME, "k"), Case.strRemoved == Case.strText ? 0 : 1);
    EXPECT_EQ(ReadFile(FILE_NAME), Case.strRemoved);
  }
}

TEST_F(CapabilityFile, KeysChangeTogetherOrNotAtAll) {
  const ZAMOCKeyChange rgChange[] = {
      {"a", "x", "%s=\"%s\"\n"}, {"b", nullptr, nullptr}, {"c", "", "%s=%s\n"}};
  const ZAMOCKeyChange rgBad[] = {{"a", "y", "%s=%s\n"}, {"b", "y", "%s=%s"}};
  WriteFile(FILE_NAME, "b=1\na=2\nd=3\na=4\n");
  EXPECT_EQ(ZAMOCFileChangeKeys(FILE_NAME, rgChange, 3), 0);
  EXPECT_EQ(ZAMOCFileChangeKeys(FILE_NAME, rgBad, 2), -1);
  EXPECT_EQ(ReadFile(FILE_NAME), "a=\"x\"\nd=3\nc=\n");
}

TEST_F(CapabilityFile, WhatIsNotOneLineOfTheKeyIsRefused) {
  WriteFile(FILE_NAME, "k=1\n");
  for (const char* szKey : {"", " k", "#k", "k=", "k\n"}) {
    EXPECT_EQ(ZAMOCFileSetKeyValue(FILE_NAME, szKey, "v", "%s=%s\n"), -1) << szKey;
  }
  for (const char* szFormat : {"", "%s=\n", "%s=%s%s\n", "%s=%d\n", "%s=%s%n\n", "%s=%s", "%s %s\n",
                               "#%s=%s\n", "%s=%s\nq=1\n"}) {
    EXPECT_EQ(ZAMOCFileSetKeyValue(FILE_NAME, "k", "v", szFormat), -1) << szFormat;
  }
  EXPECT_EQ(Set(FILE_NAME, "v\nx=1"), -1);
  EXPECT_EQ(ReadFile(FILE_NAME), "k=1\n");
}

TEST_F(CapabilityFile, ReadingIsOfOneMomentInItsThread) {
  WriteFile(FILE_NAME, "k=1");
  {
    const ZAMOCReading Reading(FILE_NAME);
    const ZAMOCReading Missing("/var/none");
    WriteFile(FILE_NAME, "k=22");
    WriteFile("/var/none", "k=22");
    EXPECT_EQ(Get(FILE_NAME), "1 1");
    EXPECT_EQ(Get("/var/none"), "-1 ");
    EXPECT_EQ(Get("/var/../var/none"), "2 22");
    EXPECT_EQ(std::async(std::launch::async, Get, FILE_NAME).get(), "2 22");
    EXPECT_EQ(ZAMOCFileRemoveKey("/var/none", "k"), 1);
  }
  EXPECT_EQ(Get(FILE_NAME), "2 22");
}

TEST_F(CapabilityFile, OnlyRegularFilesAreRead) {
  const SyslogSocket Syslog;
  mkfifo("/var/fifo", 0600);
  EXPECT_EQ(Get("/proc/self/mem"), "-1 ");
  EXPECT_EQ(Syslog.Take(), "zamoc: [/proc/self/mem]: read failed with errno [5]");
  for (const char* szFile : {"/var/none", "/var/fifo", "/var", "/dev/null"}) {
    EXPECT_EQ(Get(szFile), "-1 ") << szFile;
    EXPECT_EQ(Set(szFile, "2"), -1) << szFile;
    EXPECT_EQ(ZAMOCFileRemoveKey(szFile, "k"), -1) << szFile;
  }
}

TEST_F(CapabilityFile, ReplacementIsWholeAndNotWithoutNeed) {
  const char* const szOld = "/var/old";  // a second name of the old file
  const char* const szLink = "/var/link";
  struct stat Before;
  struct stat After;
  WriteFile(FILE_NAME, "k=1\n");
  WriteFile(LEFT_BEHIND, "k=1\n");  // by a killed process
  EXPECT_EQ(Get(LEFT_BEHIND), "-1 ");
  static_cast<void>(!chown(FILE_NAME, 12, 34));  // an ordinary user may not
  chmod(FILE_NAME, 06741);
  fs::create_hard_link(FILE_NAME, szOld);
  fs::create_symlink(FILE_NAME, szLink);
  stat(FILE_NAME, &Before);
  EXPECT_EQ(ZAMOCFileRemoveKey(szLink, "absent"), 0);
  EXPECT_EQ(fs::hard_link_count(szOld), 2U);
  EXPECT_EQ(Set(szLink, "2"), 0);
  EXPECT_EQ(ReadFile(szOld), "k=1\n");
  EXPECT_EQ(ReadFile(FILE_NAME), "k= 2\n");
  EXPECT_TRUE(fs::is_symlink(szLink));
  stat(FILE_NAME, &After);
  EXPECT_EQ(After.st_mode, Before.st_mode);
  EXPECT_EQ(After.st_uid, Before.st_uid);
  EXPECT_EQ(After.st_gid, Before.st_gid);
  EXPECT_EQ(std::distance(fs::directory_iterator("/var/services/camveld"), {}), 1);
}

TEST_F(CapabilityFile, ChangesInADirectoryTakeTurns) {
  WriteFile(FILE_NAME, "");
  const int Dir = open("/var/services/camveld", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  ASSERT_EQ(KiFlock::Lock(Dir, 0, true), 0);
  std::future<int> Waiting = std::async(std::launch::async, Set, FILE_NAME, "2");
  EXPECT_EQ(Waiting.wait_for(std::chrono::milliseconds(300)), std::future_status::timeout);
  close(Dir);
  EXPECT_EQ(Waiting.get(), 0);
}

}  // namespace

// The whole tool, as an installer runs it, on a real database and real capability files.

#include <regex>
#include <set>
#include <sstream>

#include "rig.h"
#include "utils.h"

namespace {

const string EXPECTED_DB = "/var/expected.db", EXAMPLES = TESSEL_SOURCE_DIR "/examples/";
const string VERSION_LINE = "tesselupgrader.cpp:main(): TESSEL pre-upgrade version: ";

// What is logged of a text that an action fails to run.
string Failure(const string& strAction, const string& strText, bool blConnects) {
  const string strStep = blConnects ? "execute db[0] cmd: BEGIN;" + strText + ";COMMIT;"
                                    : "connect to db[0, " + SYSTEM_DB + "]";
  return "kidb.cpp:Execute(): Failed to " + strStep + ".\ntesselupgrader.cpp:" + strAction +
         "(): KiDBExecute command (" + strText + ") error.\n";
}

class Upgrade : public Appliance {
 protected:
  static void StartOver() {
    RunCommand("cd /var; [ -e start.db ] || sqlite3 start.db <" + EXAMPLES + "appliance.sql; " +
               "rm -f log/camveld/*; cp start.db expected.db; cp start.db " + SYSTEM_DB);
  }

  // The transactions of an upgrade: of each the threshold and the name of its action, and its text.
  // Behind the SELECT of UpdateAxisA8105E the texts are not its own; they have the same effect.
  static std::vector<Lines> Transactions() {
    std::vector<Lines> Texts;
    const string strIds = Sql("/var/start.db",
                              "SELECT 'WHERE id=' || id || ' AND' FROM camera "
                              "WHERE vendor='AXIS' AND model='A8105-E'");
    for (const Lines& Action : ReadTable("actions.tsv")) {
      std::istringstream Wheres(Action[1] == "UpdateAxisA8105E" ? strIds : "WHERE\n");
      for (string strWhere; std::getline(Wheres, strWhere);) {
        for (size_t Idx = 2; Idx < Action.size(); ++Idx) {
          const string strText = std::regex_replace(Action[Idx], std::regex("WHERE"), strWhere);
          Texts.push_back({Action[0], Action[1], strText});
        }
      }
    }
    return Texts;
  }
};

TEST_F(Upgrade, EachThresholdSelectsItsActions) {
  StartOver();
  const std::vector<Lines> Texts = Transactions();
  std::set<unsigned long> Versions = {0};
  for (const Lines& Text : Texts) {
    const unsigned long Threshold = std::stoul(Text[0]);
    Versions.insert({Threshold - 1, Threshold, Threshold + 1});
  }
  for (const unsigned long Version : Versions) {
    StartOver();
    string strTexts = ";";
    for (const Lines& Text : Texts) {
      if (Version < std::stoul(Text[0])) {
        strTexts += std::regex_replace(Text[2], std::regex(";|$"), ";SELECT changes();");
      }
    }
    const string strChanges = "\n" + Sql(EXPECTED_DB, strTexts);
    EXPECT_TRUE(Version > 0 || strChanges.find("\n0\n") == string::npos)
        << "a text finds no camera in the example";
    EXPECT_EQ(RunTool(std::to_string(Version)).Status, 0);
    EXPECT_EQ(Sql(SYSTEM_DB, ".dump"), Sql(EXPECTED_DB, ".dump")) << Version;
    EXPECT_EQ(LogLines(), Lines{VERSION_LINE + std::to_string(Version)});
  }
}

// A row makes another database of the example's, lets the recorder hold it or makes it refuse a
// text. The sqlite3 shell says what a run makes of it: an action ends where the shell fails, or
// with its first text when the row names it.
TEST_F(Upgrade, HostileDatabases) {
  const string strMake =
      "rm -f /var/held; D=" + SYSTEM_DB + "; eval \"$ROW\"; E=" + EXPECTED_DB + "; rm $E; cp $D $E";
  const string strTransact = "sqlite3 -bail " + EXPECTED_DB + " \"BEGIN;$TEXT;COMMIT;\"";
  const string strCompare = "sqlite3 " + EXPECTED_DB +
                            " .dump >/var/dump; sqlite3 file:" + SYSTEM_DB +
                            "?nolock=1 .dump | diff - /var/dump";
  StartOver();
  const std::vector<Lines> Texts = Transactions();
  for (const Lines& Row : ReadTable("databases.tsv")) {
    const std::regex Named(Row[3]);
    StartOver();
    setenv("ROW", Row[2].c_str(), 1);
    RunCommand(strMake);
    string strLog = VERSION_LINE + Row[0] + "\n", strFailed;
    for (const Lines& Text : Texts) {
      setenv("TEXT", Text[2].c_str(), 1);
      if (std::stoul(Row[0]) < std::stoul(Text[0]) && Text[1] != strFailed &&
          (std::regex_match(Text[1], Named) || RunCommand(strTransact).Status != 0)) {
        strFailed = Text[1];
        strLog += Failure(Text[1], Text[2], fs::exists(SYSTEM_DB));
      }
    }
    EXPECT_EQ(RunTool(Row[0]).Status, std::stoi(Row[1])) << Row[2];
    string strIs;
    for (const string& strLine : LogLines()) {
      strIs += strLine + "\n";
    }
    // The texts of UpdateAxisA8105E are its own.
    const std::regex Axis("Execute.*(connected_wire|camdeviceoutput).*");
    EXPECT_EQ(std::regex_replace(strIs, Axis, ""), std::regex_replace(strLog, Axis, "")) << Row[2];
    EXPECT_EQ(RunCommand(strCompare).strOutput, "") << Row[2];
  }
}

TEST_F(Upgrade, CorruptPageIsAnErrorOrDoesNotMatter) {
  const string strEnv = "D=" + SYSTEM_DB + " L=" + LOG_FILE + "; ";
  const string strCheck =
      "; case $? in 0) sqlite3 $D '.dump cam%' | diff /var/upgraded - ;; "
      "255) grep -om1 'error.$' $L ;; *) echo crash ;; esac; [ ! -e $D-journal ] || echo journal";
  StartOver();
  RunTool("0; sqlite3 $D '.dump cam%' >/var/upgraded", strEnv);
  std::set<string> Ends;
  for (size_t Page = 0; Page < fs::file_size("/var/start.db") / 4096; ++Page) {
    StartOver();
    RunCommand("dd if=/dev/urandom bs=4096 count=1 conv=notrunc of=" + SYSTEM_DB +
               " seek=" + std::to_string(Page));
    Ends.insert(RunTool("0" + strCheck, strEnv).strOutput);
  }
  EXPECT_EQ(Ends, (std::set<string>{"", "error.\n"}));
}

// Each command line follows a preparation, and goes on where the one before ended.
TEST_F(Upgrade, CommandLines) {
  const string strEnv = "D=" + SYSTEM_DB + " C=" + CAP_DIR + " L=" + LOG_FILE + "; ";
  const string strShow =
      " 2>/dev/null; echo $?; cmp -s $D /var/start.db || echo changed; "
      "cat $L $C/camera 2>/dev/null | sed 's/.*: //'";
  const std::regex Version("r [\\d.]+\n");
  for (const Lines& Row : ReadTable("commandlines.tsv")) {
    StartOver();
    RunCommand(strEnv + Row[0]);
    const RUN Run = RunTool(Row[1] + strShow, strEnv);
    EXPECT_EQ(std::regex_replace(Run.strOutput, Version, "r VERSION\n"), Row[2]) << Row[1];
  }
}

TEST_F(Upgrade, CapabilityFilesChangeByTheirOwnKeys) {
  const SyslogSocket Socket;
  // As many bytes as are used of a name: what is behind them is cut off.
  const string strDir = "/var/" + string(250, 'a') + "/" + string(255, 'b');
  const string strCd = "mkdir -p " + strDir + "/dir; cd " + strDir + "; ";
  RunCommand(strCd +
             "echo pan=yes | tee a c secret \"new\nline\" $(printf %0255d) >/var/pan; mkfifo fifo; "
             "echo ptz_continuous_move=yes | cat - a >b; { head -c 99999 /dev/urandom | tr = x; "
             "echo; cat b; } >binary; cp c big; truncate -s 100M big; chmod 400 a; chmod 0 secret; "
             "ln -s /var/pan link; ln -s /dev/zero device; ln -s loop loop; ln -s none dangling; "
             "ln -s /dev/log socket");
  const string strBinary = "head -n -3 binary | md5sum",
               strBefore = RunCommand(strCd + strBinary).strOutput;
  EXPECT_EQ(RunTool("--updateCap " + strDir + "x", "setpriv --bounding-set -all").Status, 0);
  EXPECT_EQ(RunCommand(strCd + strBinary).strOutput, strBefore);
  EXPECT_EQ(RunCommand(strCd +
                       "ls -AF; cat a 0* b c link new* secret; head -n 1 big; ls /var/log/camveld")
                .strOutput,
            string(255, '0') + "\na\nb\nbig\nbinary\nc\ndangling@\ndevice@\ndir/\nfifo|\nlink@\n" +
                "loop@\nnew\nline\nsecret\nsocket@\npan= step\npan= step\npan= "
                "continuous\nptz_speed_max = 1\n" +
                "pan= step\npan= step\npan= step\npan=yes\npan=yes\n");
}

TEST_F(Upgrade, LargeCapabilityDirectoryThatOthersChange) {
  RunCommand("cd " + CAP_DIR + "; seq 100000 | xargs touch; echo pan=yes | tee a z >/dev/null; " +
             "while [ -e a ]; do echo pan=yes >b; mv b c; rm c; done &");
  EXPECT_EQ(RunTool("--updateCap " + CAP_DIR).Status, 0);
  EXPECT_EQ(RunCommand("cd " + CAP_DIR + "; cat a z; rm a; ls | grep -vc '[bc]'").strOutput,
            "pan= step\npan= step\n100001\n");
}

TEST_F(Upgrade, WritesOnlyItsFiles) {
  StartOver();
  fs::copy(EXAMPLES + "KICapInfo", CAP_DIR);
  // Each is changed twice in one transaction: what a statement may have to take back is in memory.
  Sql(SYSTEM_DB,
      "INSERT INTO camera (vendor, model, resolution, live_resolution) SELECT 'FOSCAM', "
      "'R4', '2048x1536', '2048x1536' FROM generate_series(1, 300)");
  const RUN Run = RunTool("0", "ASAN_OPTIONS=detect_leaks=0 strace -fo /var/trace -e %file");
  EXPECT_EQ(Run.Status, 0) << Run.strOutput;
  // Without ThreadSanitizer's own.
  const RUN Trace = RunCommand(
      "grep -E ' open.*O_(WRONLY|RDWR|CREAT)| (rename|unlink|link|sym|mk|trunc|ch)' /var/trace | "
      "cut -d '\"' -f 2 | grep -v ^/tmp/tsan | LC_ALL=C sort -u");
  EXPECT_EQ(Trace.strOutput, LOG_FILE + "\n" + CAP_DIR + "/.tesselupgrader.tmp\n" + SYSTEM_DB +
                                 "\n" + SYSTEM_DB + "-journal\n");
}

TEST_F(Upgrade, ValgrindFindsNothing) {
  if (sizeof(TESSEL_SANITIZE TESSEL_EMULATOR) > 1) {
    GTEST_SKIP() << "Valgrind runs neither sanitized nor foreign programs";
  }
  StartOver();
  fs::copy(EXAMPLES + "KICapInfo", CAP_DIR);
  const RUN Run = RunTool("0", "valgrind --error-exitcode=99 --leak-check=full");
  EXPECT_EQ(Run.Status, 0) << Run.strOutput;
}

}  // namespace

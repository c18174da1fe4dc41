// The whole tool, as an installer runs it, on a real database and real capability files.

#include <regex>

#include "rig.h"
#include "utils.h"

namespace {

const string EXPECTED_DB = "/var/expected.db", EXAMPLES = TESSEL_SOURCE_DIR "/examples/";
const string VERSION_LINE = "tesselupgrader.cpp:main(): TESSEL pre-upgrade version: ";

// Adds the lines for a text that an action fails to run.
void AddFailure(Lines* pLog, const string& strWhat, const string& strAction, const string& strSql) {
  pLog->push_back("kidb.cpp:Execute(): Failed to " + strWhat);
  const string strWhere = "tesselupgrader.cpp:" + strAction + "(): ";
  pLog->push_back(strWhere + "KiDBExecute command (" + strSql + ") error.");
}

class Upgrade : public Appliance {
 protected:
  // An action's threshold, its name, and the texts that it hands to the database, a transaction
  // each. Those of UpdateAxisA8105E behind its SELECT are not its own; they have the same effect.
  const std::vector<Lines> m_Actions = ReadTable("actions.tsv");

  static void StartOver() {
    RunCommand("cd /var; [ -e start.db ] || sqlite3 start.db <" + EXAMPLES + "appliance.sql; " +
               "rm -f log/camveld/*; cp start.db expected.db; cp start.db " + SYSTEM_DB);
  }

  // Compares an upgrade with what the sqlite3 shell makes of the selected texts; returns how many
  // rows each statement changed. A case is how many texts of an action pass, the action, its texts
  // when they are not as usual, and an SQL text that makes the database refuse the next.
  string Compare(unsigned long Version, const Lines& Case = {"", "", ""}) const {
    StartOver();
    Lines Log = {VERSION_LINE + std::to_string(Version)};
    string strTexts = ";";
    for (const Lines& Action : m_Actions) {
      const bool blFails = Action[1] == Case[1];
      const Lines& Row = blFails && Case.size() > 3 ? Case : Action;
      const size_t End = blFails ? 2 + std::stoul(Case[0]) : Row.size();
      for (size_t Text = 2; Version < std::stoul(Action[0]) && Text < End; ++Text) {
        strTexts += std::regex_replace(Row[Text], std::regex(";|$"), ";SELECT changes();");
      }
      if (blFails) {
        AddFailure(&Log, "execute db[0] cmd: BEGIN;" + Row[End] + ";COMMIT;.", Action[1], Row[End]);
      }
    }
    string strChanges = "\n" + Sql(EXPECTED_DB, strTexts + Case.back());
    Sql(SYSTEM_DB, Case.back());
    EXPECT_EQ(RunTool(std::to_string(Version)).Status, Case.back().empty() ? 0 : 255);
    EXPECT_EQ(Sql(SYSTEM_DB, ".dump"), Sql(EXPECTED_DB, ".dump")) << Version << Case.back();
    EXPECT_EQ(LogLines(), Log);
    return strChanges;
  }
};

TEST_F(Upgrade, EachThresholdSelectsItsActions) {
  EXPECT_EQ(Compare(0).find("\n0\n"), string::npos) << "a text finds no camera in the example";
  for (size_t Run = 0; Run < 3 * m_Actions.size(); ++Run) {
    Compare(std::stoul(m_Actions[Run / 3][0]) - 1 + Run % 3);
  }
}

TEST_F(Upgrade, FailedTextIsUndoneWholeAndEndsItsAction) {
  for (const Lines& Case : ReadTable("failures.tsv")) {
    Compare(0, Case);
  }
}

// A row makes another database of the example's, or lets the recorder hold it. The sqlite3 shell
// says what a run must make of it, one text of an action after the other until one fails; the names
// of actions that fail at once may be given.
TEST_F(Upgrade, HostileDatabases) {
  const string strMake = "rm -f /var/held; D=" + SYSTEM_DB + "; eval \"$ROW\"; cp $D ";
  const string strTransact = "sqlite3 -bail " + EXPECTED_DB + " \"BEGIN;$TEXT;COMMIT;\"";
  const string strCompare = "sqlite3 " + EXPECTED_DB +
                            " .dump >/var/dump; sqlite3 file:" + SYSTEM_DB +
                            "?nolock=1 .dump | diff - /var/dump";
  for (const Lines& Row : ReadTable("databases.tsv")) {
    StartOver();
    setenv("ROW", Row[2].c_str(), 1);
    RunCommand(strMake + EXPECTED_DB);
    for (const Lines& Action : m_Actions) {
      int Status = std::regex_match(Action[1], std::regex(Row[3])) ? 1 : 0;
      for (size_t Text = 2; Status == 0 && Text < Action.size(); ++Text) {
        setenv("TEXT", Action[Text].c_str(), 1);
        Status = RunCommand(strTransact).Status;
      }
    }
    EXPECT_EQ(RunTool(Row[0]).Status, std::stoi(Row[1])) << Row[2];
    EXPECT_EQ(RunCommand(strCompare).strOutput, "") << Row[2];
    EXPECT_EQ(RunCommand("grep -q 'error.$' " + LOG_FILE).Status, Row[1] == "0" ? 1 : 0) << Row[2];
  }
}

TEST_F(Upgrade, CorruptPageIsAnErrorOrDoesNotMatter) {
  StartOver();
  RunTool("0");
  const string strDump = "sqlite3 " + SYSTEM_DB + " '.dump cam%'";
  const string strCorrupt =
      "if [ $PAGE -lt 0 ]; then cat /dev/urandom; else tr '\\0' '\\377' "
      "</dev/zero; fi | dd bs=4096 count=1 iflag=fullblock conv=notrunc "
      "seek=${PAGE#-} of=" +
      SYSTEM_DB;
  WriteFile("/var/upgraded.sql", RunCommand(strDump).strOutput);
  const auto Pages = static_cast<int>(fs::file_size("/var/start.db") / 4096);
  int Failed = 0;
  for (int Page = 1 - Pages; Page < Pages; ++Page) {
    StartOver();
    setenv("PAGE", itos(Page).c_str(), 1);
    RunCommand(strCorrupt);
    const int Status = RunTool("0").Status;
    EXPECT_TRUE(Status == 0 || Status == 255) << Page;
    Failed += Status == 255 ? 1 : 0;
    EXPECT_EQ(Status == 0 ? RunCommand(strDump + " | diff - /var/upgraded.sql").Status
                          : RunCommand("grep -q 'error.$' " + LOG_FILE).Status,
              0)
        << Page;
    EXPECT_FALSE(fs::exists(SYSTEM_DB + "-journal")) << Page;
  }
  EXPECT_GT(Failed, Pages);
}

TEST_F(Upgrade, WithoutDatabaseEachActionFailsOnce) {
  Lines Log = {VERSION_LINE + "0"};
  for (const Lines& Action : m_Actions) {
    AddFailure(&Log, "connect to db[0, " + SYSTEM_DB + "].", Action[1], Action[2]);
  }
  EXPECT_EQ(RunTool("0").Status, 255);
  EXPECT_EQ(LogLines(), Log);
  EXPECT_FALSE(fs::exists(SYSTEM_DB));
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
  // As many bytes as are used of a name: what is behind them is cut off.
  const string strDir = "/var/" + string(250, 'a') + "/" + string(255, 'b');
  const string strCd = "mkdir -p " + strDir + "/dir; cd " + strDir + "; ";
  RunCommand(
      strCd +
      "echo pan=yes | tee a c \"new\nline\" $(printf %0255d) >/var/pan; mkfifo fifo; "
      "echo ptz_continuous_move=yes | cat - a >b; { head -c 99999 /dev/urandom | tr = x; "
      "echo; cat b; } >binary; cp c big; truncate -s 100M big; chmod 400 a; ln -s /var/pan link; "
      "ln -s /dev/zero device; ln -s loop loop; ln -s none dangling");
  const string strBinary = "head -n -3 binary | md5sum",
               strBefore = RunCommand(strCd + strBinary).strOutput;
  EXPECT_EQ(RunTool("--updateCap " + strDir + "x").Status, 0);
  EXPECT_EQ(RunCommand(strCd + strBinary).strOutput, strBefore);
  EXPECT_EQ(RunCommand(strCd + "ls -AF; cat a 0* b c link new*; head -n 1 big; ls /var/log/camveld")
                .strOutput,
            string(255, '0') + "\na\nb\nbig\nbinary\nc\ndangling@\ndevice@\ndir/\nfifo|\nlink@\n" +
                "loop@\nnew\nline\npan= step\npan= step\npan= continuous\nptz_speed_max = 1\n" +
                "pan= step\npan= step\npan= step\npan=yes\n");
}

TEST_F(Upgrade, LargeCapabilityDirectoryThatOthersChange) {
  RunCommand("cd " + CAP_DIR + "; seq 100000 | xargs touch; echo pan=yes | tee a z >/dev/null; " +
             "while [ -e a ]; do echo pan=yes >b; mv b c; rm c; done &");
  EXPECT_EQ(RunTool("--updateCap " + CAP_DIR).Status, 0);
  EXPECT_EQ(RunCommand("cd " + CAP_DIR + "; cat a z; rm a; ls | grep -vc '[bc]'").strOutput,
            "pan= step\npan= step\n100001\n");
}

TEST_F(Upgrade, WritesOnlyItsFilesAndThoseInAnOrderThatLasts) {
  StartOver();
  fs::copy(EXAMPLES + "KICapInfo", CAP_DIR);
  // Each is changed twice in one transaction: what a statement may have to take back is in memory.
  Sql(SYSTEM_DB,
      "INSERT INTO camera (vendor, model, resolution, live_resolution) SELECT 'FOSCAM', "
      "'R4', '2048x1536', '2048x1536' FROM generate_series(1, 300)");
  const RUN Run = RunTool("0", "ASAN_OPTIONS=detect_leaks=0 strace -fyo /var/trace -e %file,fsync");
  EXPECT_EQ(Run.Status, 0) << Run.strOutput;
  // Without ThreadSanitizer's own.
  const RUN Trace = RunCommand(
      "grep -E ' open.*O_(WRONLY|RDWR|CREAT)| (rename|unlink|link|sym|mk|trunc|ch)' /var/trace | "
      "cut -d '\"' -f 2 | grep -v ^/tmp/tsan | LC_ALL=C sort -u; "
      "sed -n 's/.*rename.*/rename/p; s/.*fsync.*upgrader.tmp>.*/data/p; "
      "s/.*fsync.*@KICapInfo>.*/directory/p' /var/trace | paste -d ' ' - - - | sort -u");
  EXPECT_EQ(Trace.strOutput, LOG_FILE + "\n" + CAP_DIR + "/.tesselupgrader.tmp\n" + SYSTEM_DB +
                                 "\n" + SYSTEM_DB + "-journal\ndata rename directory\n");
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

// The whole tool, as an installer runs it, on a real database and real capability files.

#include <cstring>
#include <fstream>
#include <map>
#include <regex>
#include <set>

#include "rig.h"
#include "utils.h"

namespace {

const string START_DB = "/var/start.db", EXPECTED_DB = "/var/expected.db";
const string CAP_FILE = string(CAP_DIR) + "/camera";

// A row of actions.tsv: the texts that an action hands to the database, a transaction each. Those
// of UpdateAxisA8105E behind its SELECT are not its own; they have the same effect.
struct ACTION {
  uint32_t orgVersion;
  string strName;
  Lines Texts;
};

std::vector<ACTION> ReadActions() {
  std::vector<ACTION> Actions;
  for (const Lines& Row : ReadTable("actions.tsv")) {
    Actions.push_back(
        {static_cast<uint32_t>(std::stoul(Row[0])), Row[1], {Row.begin() + 2, Row.end()}});
  }
  return Actions;
}

string VersionLine(const string& strVersion) {
  return "tesselupgrader.cpp:main(): TESSEL pre-upgrade version: " + strVersion;
}

string ActionLine(const string& strAction, const string& strText) {
  return "tesselupgrader.cpp:" + strAction + "(): KiDBExecute command (" + strText + ") error.";
}

class Upgrade : public Appliance {
 protected:
  void SetUp() override {
    Appliance::SetUp();
    Sql(START_DB, ReadFile(TESSEL_SOURCE_DIR "/examples/appliance.sql"));
    StartOver();
  }

  static void StartOver() {
    fs::copy_file(START_DB, SYSTEM_DB, fs::copy_options::overwrite_existing);
    fs::copy_file(START_DB, EXPECTED_DB, fs::copy_options::overwrite_existing);
    fs::remove(LOG_FILE);
  }

  const std::vector<ACTION> m_Actions = ReadActions();
};

TEST_F(Upgrade, EachThresholdSelectsItsActions) {
  std::set<uint32_t> Versions = {0};
  for (const ACTION& Action : m_Actions) {
    Versions.insert({Action.orgVersion - 1, Action.orgVersion, Action.orgVersion + 1});
  }
  for (const uint32_t Version : Versions) {
    StartOver();
    string strTexts;
    for (const ACTION& Action : m_Actions) {
      for (size_t Text = 0; Version < Action.orgVersion && Text < Action.Texts.size(); ++Text) {
        strTexts += std::regex_replace(Action.Texts[Text], std::regex(";|$"), ";SELECT changes();");
      }
    }
    const string strChanges = "\n" + Sql(EXPECTED_DB, strTexts);
    EXPECT_FALSE(Version == 0 && strChanges.find("\n0\n") != string::npos)
        << "a statement finds no camera in the example" << strChanges;
    EXPECT_EQ(RunTool(itos(Version)).Status, 0);
    EXPECT_EQ(Sql(SYSTEM_DB, ".dump"), Sql(EXPECTED_DB, ".dump")) << Version;
    EXPECT_EQ(LogLines(), Lines{VersionLine(itos(Version))});
  }
}

TEST_F(Upgrade, WithoutDatabaseEachActionFailsOnce) {
  fs::remove(SYSTEM_DB);
  Lines Expected = {VersionLine("0")};
  for (const ACTION& Action : m_Actions) {
    Expected.push_back("kidb.cpp:Execute(): Failed to connect to db[0, " + string(SYSTEM_DB) +
                       "].");
    Expected.push_back(ActionLine(Action.strName, Action.Texts[0]));
  }
  EXPECT_EQ(RunTool("0").Status, 255);
  EXPECT_EQ(LogLines(), Expected);
  EXPECT_FALSE(fs::exists(SYSTEM_DB));
}

TEST_F(Upgrade, FailedTextIsUndoneWholeAndEndsItsAction) {
  for (const Lines& Case : ReadTable("failures.tsv")) {
    StartOver();
    Lines Log = {VersionLine("0")};
    string strDone;
    for (const ACTION& Action : m_Actions) {
      const bool blFails = Action.strName == Case[0];
      const Lines Texts =
          Case.size() > 3 && blFails ? Lines(Case.begin() + 3, Case.end()) : Action.Texts;
      const size_t Done = blFails ? std::stoul(Case[2]) : Texts.size();
      for (size_t Text = 0; Text < Done; ++Text) {
        strDone += Texts[Text] + ";";
      }
      if (blFails) {
        Log.push_back("kidb.cpp:Execute(): Failed to execute db[0] cmd: BEGIN;" + Texts[Done] +
                      ";COMMIT;.");
        Log.push_back(ActionLine(Action.strName, Texts[Done]));
      }
    }
    const string strTrigger =
        "CREATE TRIGGER t BEFORE " + Case[1] + " BEGIN SELECT RAISE(ABORT,'refused'); END;";
    Sql(EXPECTED_DB, strDone + strTrigger);
    Sql(SYSTEM_DB, strTrigger);
    EXPECT_EQ(RunTool("0").Status, 255);
    EXPECT_EQ(Sql(SYSTEM_DB, ".dump"), Sql(EXPECTED_DB, ".dump")) << Case[1];
    EXPECT_EQ(LogLines(), Log);
  }
}

TEST_F(Upgrade, CommandLine) {
  const std::regex Usage(
      "tesselupgrader [\\d.]+\nUsage:\ntesselupgrader "
      "\\{pre-upgrade-version\\}\\|\\{--updateCap remote-cap-dir\\}\n");
  for (const char* szArgs : {"", "1 2 3", "--update /var", "--updatecap /var"}) {
    const RUN Run = RunTool(szArgs);
    EXPECT_EQ(Run.Status, 1);
    EXPECT_TRUE(std::regex_match(Run.strOutput, Usage)) << Run.strOutput;
    EXPECT_FALSE(fs::exists(LOG_FILE));
  }
  const std::pair<const char*, string> rgVersionOfArg[] = {
      {"-1", "4294967295"}, {"2475x", "2475"},
      {"' +2475'", "2475"}, {"99999999999", "2147483647"},
      {"abc", "0"},         {"''", "0"},
      {"--updateCap", "0"}, {"-99999999999999999999", "2147483648"},
  };
  for (const auto& [szArg, strVersion] : rgVersionOfArg) {
    StartOver();
    EXPECT_EQ(RunTool(szArg).Status, 0) << szArg;
    EXPECT_EQ(LogLines(), Lines{VersionLine(strVersion)});
    EXPECT_EQ(Sql(SYSTEM_DB, ".dump") != Sql(START_DB, ".dump"), strVersion == "0") << szArg;
  }
  Sql(SYSTEM_DB, "DELETE FROM camera");
  EXPECT_EQ(RunTool("2400").Status, 0);
  EXPECT_EQ(LogLines().back(),
            "tesselupgrader.cpp:UpdateAxisA8105E(): There's no info in camera table.");
}

TEST_F(Upgrade, CapabilityDirectoryIsThePackagesOwn) {
  const auto Run = [](const char* szArgs) {
    const string strStatus = itos(RunTool(szArgs).Status);
    return strStatus + " " + ReadFile(CAP_FILE);
  };
  WriteFile(CAP_FILE, "pan=yes\ntilt=continuous\n");
  EXPECT_EQ(Run("80"), "0 pan=yes\ntilt=continuous\n");
  EXPECT_EQ(Run("68"), "0 pan=yes\ntilt=continuous\nptz_speed_max = 1\n");
  EXPECT_EQ(Run("67"), "0 pan= step\ntilt=continuous\nptz_speed_max = 1\n");
  fs::remove_all(CAP_DIR);
  EXPECT_EQ(Run("0"), "0 ");
  const fs::path Parent = fs::path(CAP_DIR).parent_path();
  fs::remove_all(Parent);
  EXPECT_EQ(Run("80"), "0 ");
  EXPECT_EQ(Run("79"), "255 ");
  WriteFile(Parent, "");
  EXPECT_EQ(Run("79"), "255 ");
  EXPECT_EQ(Run("--updateCap ''"), "255 ");
  EXPECT_EQ(Run("--updateCap /var/none"), "0 ");
}

TEST_F(Upgrade, CapabilityFilesChangeByTheirOwnKeys) {
  // 511 bytes, as many as are used of a name; the "/." behind it is cut off.
  const string strDir = "/var/" + string(250, 'a') + "/" + string(255, 'b');
  fs::create_directories(strDir + "/subdirectory");
  int File = 0;
  for (const Lines& Row : ReadTable("capfiles.tsv")) {
    WriteFile(strDir + "/" + itos(File++), Row[0]);
  }
  WriteFile("/var/elsewhere", "pan=yes\n");
  RunCommand("cd " + strDir + " && mkfifo fifo && ln -s /var/elsewhere link && " +
             "ln -s /dev/zero device && ln -s none dangling && ln -s loop loop");

  EXPECT_EQ(RunTool("--updateCap " + strDir + "/.").Status, 0);
  File = 0;
  for (const Lines& Row : ReadTable("capfiles.tsv")) {
    EXPECT_EQ(ReadFile(strDir + "/" + itos(File++)), Row[1]) << "from " << Row[0];
  }
  EXPECT_EQ(ReadFile("/var/elsewhere"), "pan= step\n");
  EXPECT_TRUE(fs::is_symlink(strDir + "/link"));
  EXPECT_EQ(std::distance(fs::directory_iterator(strDir), {}), File + 6);
  EXPECT_FALSE(fs::exists(LOG_FILE));
  EXPECT_EQ(Sql(SYSTEM_DB, ".dump"), Sql(START_DB, ".dump"));

  fs::create_directory(string(CAP_DIR) + "/.tesselupgrader.tmp");  // no file can be replaced
  for (const auto& [strContent, Status] : std::map<string, int>{
           {"pan=yes\ntilt=continuous\n", 0}, {"pan=yes\nptz_continuous_move=yes\n", 255}}) {
    WriteFile(CAP_FILE, strContent);
    EXPECT_EQ(RunTool(string("--updateCap ") + CAP_DIR).Status, Status);
    EXPECT_EQ(ReadFile(CAP_FILE), strContent);
  }
}

TEST_F(Upgrade, WritesOnlyItsFilesAndThoseInAnOrderThatLasts) {
  fs::copy(TESSEL_SOURCE_DIR "/examples/KICapInfo", CAP_DIR);
  Sql(SYSTEM_DB,
      "INSERT INTO camera (vendor,model,resolution) SELECT 'FOSCAM','R4','2048x1536' FROM "
      "(WITH RECURSIVE c(n) AS (SELECT 1 UNION ALL SELECT n+1 FROM c LIMIT 2000) SELECT * FROM c)");
  const RUN Run = RunTool("0",
                          "ASAN_OPTIONS=detect_leaks=0 strace -f -y -o /var/trace "
                          "-e trace=%file,fsync,fdatasync,ftruncate");
  EXPECT_EQ(Run.Status, 0) << Run.strOutput;
  const std::regex Write(
      R"(^\d+ +(?=open.*O_(WRONLY|RDWR|CREAT)|rename|unlink|link|sym|mk|trunc|ch)[^"]*"([^"]*))");
  std::set<string> Written;
  string strOrder;
  std::ifstream Trace("/var/trace");
  for (string strLine; std::getline(Trace, strLine);) {
    std::smatch Match;
    if (std::regex_search(strLine, Match, Write)) {
      Written.insert(Match[2]);
    }
    if (strLine.find("rename") != string::npos) {
      strOrder += "rename ";
    } else if (strLine.find("fsync") != string::npos && strLine.find(CAP_DIR) != string::npos) {
      strOrder += strLine.find("/.tesselupgrader.tmp") != string::npos ? "data " : "directory ";
    }
  }
  EXPECT_TRUE(std::regex_match(strOrder, std::regex("(data rename directory ){5,}"))) << strOrder;
  for (const string& strPath : {string(LOG_FILE), string(SYSTEM_DB), SYSTEM_DB + string("-journal"),
                                CAP_DIR + string("/.tesselupgrader.tmp")}) {
    EXPECT_EQ(Written.erase(strPath), 1u) << strPath;
  }
  for (const string& strPath : Written) {
    EXPECT_EQ(strPath.rfind("/tmp/tsan.", 0), 0u) << strPath;  // ThreadSanitizer's own
  }
}

TEST_F(Upgrade, ValgrindFindsNothing) {
  if (strlen(TESSEL_SANITIZE) + strlen(TESSEL_EMULATOR) > 0) {
    GTEST_SKIP() << "Valgrind runs neither sanitized nor foreign programs";
  }
  fs::copy(TESSEL_SOURCE_DIR "/examples/KICapInfo", CAP_DIR);
  const RUN Run = RunTool("0", "valgrind --error-exitcode=99 --leak-check=full");
  EXPECT_EQ(Run.Status, 0) << Run.strOutput;
}

}  // namespace

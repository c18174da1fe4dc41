// The whole tool, as an installer runs it, on a real database and real capability files.

#include <algorithm>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <regex>
#include <set>
#include <sstream>

#include "rig.h"
#include "utils.h"

namespace fs = std::filesystem;
using std::string;
using Lines = std::vector<string>;

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
  std::ifstream Rows(TESSEL_SOURCE_DIR "/tests/actions.tsv");
  for (string strRow; std::getline(Rows, strRow);) {
    std::istringstream Fields(strRow);
    ACTION& Action = Actions.emplace_back();
    Fields >> Action.orgVersion >> Action.strName >> std::ws;
    for (string strText; std::getline(Fields, strText, '\t');) {
      Action.Texts.push_back(strText);
    }
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
  const ACTION& Axis = *std::find_if(m_Actions.begin(), m_Actions.end(), [](const ACTION& Action) {
    return Action.strName == "UpdateAxisA8105E";
  });
  const string &strUpdate = Axis.Texts[1], &strInsert = Axis.Texts[2];
  const struct {
    string strAction, strRefused;
    size_t FailingText;
    Lines Texts;  // in place of the action's own
  } rgCase[] = {
      {"RenameAbusTvip62000Reso",
       "UPDATE OF resolution ON camera WHEN new.resolution='640x480'",
       1,
       {}},
      {"UpdateCameraModelRenameForHIKVISION",
       "UPDATE OF model ON camera WHEN new.model='DS-2CD783F-E'",
       3,
       {}},
      {"UpdateToshibaIKWD01AAndIKWB70AReso",
       "UPDATE OF mobile_resolution ON camera WHEN new.mobile_resolution='352x240'",
       0,
       {}},
      {"UpdateDAHUASD4XC212S",
       "UPDATE OF mobile_resolution ON camera WHEN new.mobile_resolution='1280x720'",
       0,
       {}},
      {Axis.strName,
       "UPDATE OF connected_wire ON camera WHEN new.id=149",
       2,
       {strUpdate + " AND id<149", strInsert + " AND id<149",
        "UPDATE camera SET connected_wire='\2\1' WHERE vendor='AXIS' AND model='A8105-E' AND "
        "id=149;"}},
      {Axis.strName,
       "INSERT ON camdeviceoutput WHEN new.cam_id=149",
       2,
       {strUpdate + " AND id<=149", strInsert + " AND id<149",
        "INSERT INTO camdeviceoutput (cam_id, cam_id_on_rec_server, owner_ds_id, type, idx, name) "
        "VALUES (149, 0, 0, 1, 1, 'DO 2');"}},
  };
  for (const auto& Case : rgCase) {
    StartOver();
    Lines Log = {VersionLine("0")};
    string strDone;
    for (const ACTION& Action : m_Actions) {
      const bool blFails = Action.strName == Case.strAction;
      const Lines& Texts = blFails && !Case.Texts.empty() ? Case.Texts : Action.Texts;
      const size_t Done = blFails ? Case.FailingText : Texts.size();
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
        "CREATE TRIGGER t BEFORE " + Case.strRefused + " BEGIN SELECT RAISE(ABORT,'refused'); END;";
    Sql(EXPECTED_DB, strDone + strTrigger);
    Sql(SYSTEM_DB, strTrigger);
    EXPECT_EQ(RunTool("0").Status, 255);
    EXPECT_EQ(Sql(SYSTEM_DB, ".dump"), Sql(EXPECTED_DB, ".dump")) << Case.strRefused;
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
  const std::pair<string, string> rgBeforeAfter[] = {
      {"ptz_continuous_move=yes\npan=yes\ntilt=no\n",
       "pan= continuous\ntilt=no\nptz_speed_max = 1\n"},
      {"zoom=\"yes\"\r\nptz_continuous_move = \"yes\"\r\n", "zoom= continuous\n"},
      {"pan=yes\ntilt=yes\nzoom=yes", "pan= step\ntilt= step\nzoom= step\n"},
      {"ptz_continuous_move=no\npan=yes\n", "ptz_continuous_move=no\npan= step\n"},
      {"ptz_continuous_move=Yes\npan=YES\n", "ptz_continuous_move=Yes\npan=YES\n"},
      {"tilt=continuous", "tilt=continuous\nptz_speed_max = 1\n"},
      {"zoom=continuous\npan=step\n", "zoom=continuous\npan=step\n"},
      {"pan=continuous\nptz_speed_max=7\n", "pan=continuous\nptz_speed_max=7\n"},
      {"ptz_speed_max=\npan=continuous\n", "ptz_speed_max = 1\npan=continuous\n"},
  };
  // 511 bytes, as many as are used of a name; the "/." behind it is cut off.
  const string strDir = "/var/" + string(250, 'a') + "/" + string(255, 'b');
  fs::create_directories(strDir + "/subdirectory");
  int File = 0;
  for (const auto& [strBefore, strAfter] : rgBeforeAfter) {
    WriteFile(strDir + "/" + itos(File++), strBefore);
  }
  WriteFile("/var/elsewhere", "pan=yes\n");
  RunCommand("cd " + strDir + " && mkfifo fifo && ln -s /var/elsewhere link && " +
             "ln -s /dev/zero device && ln -s none dangling && ln -s loop loop");

  EXPECT_EQ(RunTool("--updateCap " + strDir + "/.").Status, 0);
  File = 0;
  for (const auto& [strBefore, strAfter] : rgBeforeAfter) {
    EXPECT_EQ(ReadFile(strDir + "/" + itos(File++)), strAfter) << "from " << strBefore;
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

// Categories and levels, and the shared configuration that decides which messages are written.

#include <cerrno>
#include <set>

#include "kidebuglog.h"
#include "rig.h"
#include "utils.h"

namespace {

LOG_CATEG Categ(int Value) { return static_cast<LOG_CATEG>(Value); }
LOG_LEVEL Level(int Value) { return static_cast<LOG_LEVEL>(Value); }

class DbgLog : public Appliance {};

// Attaches a segment that is made as another program makes it, by its key and size.
void Create(int Mode) {
  RunCommand("ipcrm -M 0x18180004");
  EXPECT_NE(shmget(0x18180004, 2568, IPC_CREAT | Mode), -1);
  InitDbgCfg();
}

// The switch, each category whose threshold is not that of the one before it, and the processes.
string Show(const KiDbgLogCfg& Cfg = *g_pDbgLogCfg) {
  string strLevels = Cfg.LogInMs() ? "ms" : "s", strPids;
  LOG_LEVEL Last = LOG_LEVEL_ALARM, Next = Last;
  pid_t Pid = 0;
  for (int Idx = -1; Idx <= LOG_CATEG_MAX; ++Idx, Last = Next) {
    strPids += Cfg.GetPidLevel(Idx, Pid, Next) == 0 ? " " + itos(Pid) + "=" + itos(Next) : "";
    Next = Cfg.GetLogLevel(Categ(Idx));
    strLevels += Next == Last ? "" : " " + itos(Idx) + ":" + itos(Next);
  }
  return strLevels + strPids;
}

TEST_F(DbgLog, EveryCategoryAndLevelHasAName) {
  std::set<string> Categs;
  string strNames = Enum2String(Categ(66));
  for (int Value = -1; Value <= LOG_CATEG_TOTAL; ++Value) {
    Categs.insert(Enum2String(Categ(Value)));
    strNames += Value <= LOG_LEVEL_TOTAL ? string(" ") + Enum2String(Level(Value)) : "";
  }
  EXPECT_EQ(Categs.size(), 88u + Categs.count("unknown"));
  EXPECT_EQ(strNames, "utils unknown alarm error warn notice info debug debug2 debug3 unknown");
}

TEST_F(DbgLog, StaysInsideItsMemory) {
  Create(0666);
  auto* const pWords = reinterpret_cast<int32_t*>(g_pDbgLogCfg);  // [513] is the count
  for (int Pid = 1; Pid <= 65; ++Pid) {
    g_pDbgLogCfg->SetPidLevel(Pid, LOG_LEVEL_DEBUG);
  }
  pWords[513] = 65;
  g_pDbgLogCfg->SetPidLevel(64, LOG_LEVEL_ERROR);
  g_pDbgLogCfg->SetPidLevel(65, LOG_LEVEL_ERROR);
  const string strRest = RunCommand("printf ' %d=5' $(seq 2 63)").strOutput + " 64=1";
  EXPECT_EQ(Show(), "s 1=5" + strRest);
  g_pDbgLogCfg->ClearPid(65);
  g_pDbgLogCfg->ClearPid(1);
  EXPECT_EQ(Show(), "s" + strRest);
  pWords[513] = -1;
  pWords[0] = 2;
  g_pDbgLogCfg->SetPidLevel(7, LOG_LEVEL_INFO);
  for (const int Value : {-1, 511, 512}) {  // the neighbours are the switch and the count
    g_pDbgLogCfg->SetLogLevel(Categ(Value), Level(256));
  }
  EXPECT_EQ(Show(), "ms 511:256 512:0 7=4");
  EXPECT_EQ(pWords[642] | pWords[643], 0);
}

TEST_F(DbgLog, ProgramsObeyTheSegmentThatIsThereWhenTheyStart) {
  RunCommand("ipcrm -M 0x18180004");
  string strAttached = RunProgram(TESSEL_CLIENT, "log 52 7").strOutput;
  Create(0);
  strAttached += RunProgram(TESSEL_CLIENT, "log 52 7", "setpriv --bounding-set -all").strOutput;
  g_pDbgLogCfg->SetLogLevel(LOG_CATEG_EVENT, LOG_LEVEL_NOTICE);
  strAttached += RunProgram(TESSEL_CLIENT, "log 52 3").strOutput;
  strAttached += RunProgram(TESSEL_CLIENT, "log 52 4").strOutput;
  EXPECT_EQ(strAttached, "0000000001100110");  // before main, in it, after it, at the very end
  RunTool("2475");
  g_pDbgLogCfg->SetLogInMs(true);
  RunTool("2475");
  const string strSed = R"(sed -E 's/.{15}(\S*) .\w+.(\[event..)?(\w*).*/\1\3/; s/[0-9]{3}/ms/' )";
  EXPECT_EQ(RunCommand(strSed + LOG_FILE).strOutput, "debug3\ndebug3\nnotice\n\n.ms\n");
}

TEST_F(DbgLog, GateAsksTheCategoryThenTheProcess) {
  Create(0666);
  RunCommand("ipcrm -M 0x18180004");  // what is attached stays usable
  int Own = getpid(), Written = 0;
  // The threshold of the category, of which process, and how many messages there are then.
  const int rgCase[][4] = {{3, 1, 7, 4},    {-1, 1, 7, 5},    {99, 1, 7, 13},
                           {3, Own, 4, 18}, {3, Own, -1, 22}, {-1, Own, -1, 22}};
  for (const auto& [Threshold, Pid, PidThreshold, Expected] : rgCase) {
    g_pDbgLogCfg->SetLogLevel(LOG_CATEG_EVENT, Level(Threshold));
    g_pDbgLogCfg->SetPidLevel(Pid, Level(PidThreshold));
    for (int Value = 0; Value < LOG_LEVEL_TOTAL; ++Value) {
      errno = 42;
      KIDBGLOG(LOG_CATEG_EVENT, Level(Value), "errno %d, %d\n", errno, ++Written);
    }
    EXPECT_EQ(Written, Expected);
  }
  EXPECT_EQ(LogLines().back(), "[event][notice] dbglog_test.cpp:TestBody(): errno 42, 22");
}

TEST_F(DbgLog, SettingsOutlastTheSegment) {
  const string strFile = "/var/packages/Camveld/etc/settings.conf";
  fs::create_directories("/var/packages/Camveld/etc");
  Create(0666);
  g_pDbgLogCfg->SetPidLevel(1, LOG_LEVEL_INFO);
  g_pDbgLogCfg->SetLogInMs(true);
  for (const Lines& Row : ReadTable("dbglog.tsv")) {
    WriteFile(strFile, Row[0]);
    EXPECT_EQ(RunProgram(TESSEL_CLIENT, "create").Status, 0);
    EXPECT_EQ(Show(), Row[1]);
    EXPECT_EQ(g_pDbgLogCfg->SaveDbgLogSettings(), 0);
    EXPECT_EQ(RunCommand("sed -E 's/3(,3){83}/3*84/' " + strFile).strOutput, Row[2]);
  }
  RunCommand("{ printf ki_dbglog_settings=; yes 7, | head -n 600 | tr -d '\\n'; } >" + strFile);
  EXPECT_EQ(g_pDbgLogCfg->LoadDbgLogSettings(), 1);
  fs::remove_all("/var/packages");
  EXPECT_EQ(g_pDbgLogCfg->LoadDbgLogSettings() + g_pDbgLogCfg->SaveDbgLogSettings(), -2);
  EXPECT_EQ(Show(), "ms 0:7 512:0");
}

}  // namespace

// layout write|read
//
// Writes the shared configuration, every field of it filled, to standard output, or reads it from
// standard input and ends with 1 when a field is another.

#include <cstdio>
#include <cstring>

#include "kidebuglog.h"

static LOG_LEVEL Level(int Idx) { return static_cast<LOG_LEVEL>(Idx * 7 % LOG_LEVEL_TOTAL); }

static void Fill(KiDbgLogCfg* pCfg) {
  pCfg->SetLogInMs(true);
  for (int Idx = 0; Idx < LOG_CATEG_MAX; ++Idx) {
    pCfg->SetLogLevel(static_cast<LOG_CATEG>(Idx), Level(Idx));
  }
  for (int Idx = 0; Idx < 64; ++Idx) {
    pCfg->SetPidLevel(4000000 + Idx, Level(Idx));
  }
}

static bool IsFilled(const KiDbgLogCfg& Cfg) {
  bool blSame = Cfg.LogInMs();
  for (int Idx = 0; Idx < LOG_CATEG_MAX; ++Idx) {
    blSame = blSame && Cfg.GetLogLevel(static_cast<LOG_CATEG>(Idx)) == Level(Idx);
  }
  for (int Idx = 0; Idx < 64; ++Idx) {
    blSame = blSame && Cfg.GetPidLevel(4000000 + Idx) == Level(Idx);
  }
  return blSame;
}

int main(int /*argc*/, char** argv) {
  KiDbgLogCfg Cfg = {};
  if (strcmp(argv[1], "write") == 0) {
    Fill(&Cfg);
    return fwrite(&Cfg, sizeof(Cfg), 1, stdout) == 1 ? 0 : 1;
  }
  return fread(&Cfg, sizeof(Cfg), 1, stdin) == 1 && IsFilled(Cfg) ? 0 : 1;
}

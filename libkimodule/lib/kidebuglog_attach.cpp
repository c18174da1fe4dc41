// Attaches the configuration. The static and the shared library each compile this file; they share
// the objects of all other sources.
#include "kidebuglog.h"
#include "utils.h"

KiDbgLogCfg* g_pDbgLogCfg = nullptr;

void InitDbgCfg() { g_pDbgLogCfg = KiShmDbgLogCfgAt(); }

void FreeDbgCfg() { ShmDt(g_pDbgLogCfg); }

// The linker places the objects of a static library after the program's own, so AtStart runs after
// the constructors of the program's global objects. It links this object into every program that
// uses the log, because the log needs g_pDbgLogCfg. The hooks of a shared library would run too
// early, so the program itself contains kidebuglog_start.cpp instead.
#ifndef KIMODULE_SHARED
__attribute__((constructor)) static void AtStart() { InitDbgCfg(); }
__attribute__((destructor)) static void AtExit() { FreeDbgCfg(); }
#endif

// Attaches the configuration. Compiled for each form of the library, unlike its other sources.
#include "kidebuglog.h"
#include "utils.h"

KiDbgLogCfg* g_pDbgLogCfg = nullptr;

void InitDbgCfg() { g_pDbgLogCfg = KiShmDbgLogCfgAt(); }

void FreeDbgCfg() { ShmDt(g_pDbgLogCfg); }

// The linker places the objects of a static library behind the program's own, so these hooks run
// when the program's global objects are constructed. It takes this object into every program that
// uses the log, which needs g_pDbgLogCfg. The hooks of a shared library would run too early: there
// the program itself contains kidebuglog_start.cpp.
#ifndef KIMODULE_SHARED
__attribute__((constructor)) static void AtStart() { InitDbgCfg(); }
__attribute__((destructor)) static void AtExit() { FreeDbgCfg(); }
#endif

// The start-up and exit hooks of programs that use the shared library. Linked into the program
// itself, after its own objects, because a shared library's constructors would run before the
// program's.
#include "kidebuglog.h"

__attribute__((constructor)) static void AtStart() { InitDbgCfg(); }
__attribute__((destructor)) static void AtExit() { FreeDbgCfg(); }

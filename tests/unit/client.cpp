// A program of the package. Prints whether the shared configuration is attached while its global
// object is constructed, in main, while the object is destroyed, and at the very end. Logs at the
// last two.

#include <fileutils.h>
#include <kidebuglog.h>
#include <unistd.h>

#include <cstdio>
#include <string>

static void PrintAttached() { printf("%d", g_pDbgLogCfg != nullptr); }

static void End() {
  PrintAttached();
  KIDBGLOG(LOG_CATEG_EVENT, LOG_LEVEL_ALARM, "End\n");
}

static struct Global {
  Global() { PrintAttached(); }
  ~Global() { End(); }
} gGlobal;

__attribute__((destructor(101))) static void AtTheVeryEnd() { End(); }

// loop | get FILE KEY | set FILE KEY VALUE
int main(int /*argc*/, char** argv) {
  const std::string strCommand = argv[1];
  PrintAttached();
  alarm(30);  // a failed test may leave the process behind
  while (strCommand == "loop") {
    KIDBGLOG(LOG_CATEG_RTSP_SERVER, LOG_LEVEL_DEBUG, "x\n");
    usleep(10000);
  }
  std::string strVal;
  return strCommand == "get" ? KiFileGetVal(argv[2], argv[3], strVal) < 0
                             : KiFileSetVal(argv[2], argv[3], argv[4], true) != 0;
}

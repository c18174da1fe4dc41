// A small program of the package. Prints whether the shared configuration is attached while its
// global object is constructed, in main, while the object is destroyed, and at the very end.

#include <fileutils.h>
#include <kidebuglog.h>
#include <sys/shm.h>

#include <cstdio>
#include <string>

static void PrintAttached() { printf("%d", g_pDbgLogCfg != nullptr); }

static struct Global {
  Global() { PrintAttached(); }
  ~Global() { PrintAttached(); }
} gGlobal;

__attribute__((destructor(101))) static void AtTheVeryEnd() {
  PrintAttached();
  fflush(stdout);
}

// create | log CATEG LEVEL | get FILE KEY | set FILE KEY VALUE
int main(int /*argc*/, char** argv) {
  PrintAttached();
  const std::string strCommand = argv[1];
  if (strCommand == "create") {
    const int Id = shmget(KiShmDbgLogIPCKey(), sizeof(KiDbgLogCfg), IPC_CREAT | 0666);
    KiShmDbgLogCfgAt()->Init(KiShmDbgLogIPCKey());
    return Id == -1;
  }
  if (strCommand == "log") {
    KIDBGLOG(static_cast<LOG_CATEG>(std::stoi(argv[2])), static_cast<LOG_LEVEL>(std::stoi(argv[3])),
             "x\n");
    return 0;
  }
  std::string strVal;
  return strCommand == "get" ? KiFileGetVal(argv[2], argv[3], strVal) < 0
                             : KiFileSetVal(argv[2], argv[3], argv[4], true) != 0;
}

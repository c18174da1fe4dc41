// The package's log: one call appends one line to a log file that all of its processes share, and
// one configuration, shared too, decides which messages are written.
#pragma once

#include <sys/types.h>
#include <unistd.h>

#include <cstddef>
#include <cstdint>

#include "enumtostr.h"

// Which log file a line goes to.
enum LOG_TYPE : int {
  KI_LOG = 0,            // /var/log/camveld/camveld.log
  NOTIFICATION_LOG = 1,  // /var/log/camveld/kinotification.log
};

// How severe a message is: the smaller, the more.
enum LOG_LEVEL : int {
  LOG_LEVEL_ALARM = 0,
  LOG_LEVEL_ERROR = 1,
  LOG_LEVEL_WARN = 2,
  LOG_LEVEL_NOTICE = 3,
  LOG_LEVEL_INFO = 4,
  LOG_LEVEL_DEBUG = 5,
  LOG_LEVEL_DEBUG2 = 6,
  LOG_LEVEL_DEBUG3 = 7,
  LOG_LEVEL_TOTAL = 8,  // how many there are, not a level
};

// Which component of the package a message comes from.
enum LOG_CATEG : int {
#define LOG_CATEG_ENTRY(Categ, Value, szName) Categ = (Value),
#include "logcateg.def"
  LOG_CATEG_TOTAL = 88,  // how many there are, not a category
  LOG_CATEG_MAX = 512,   // how many there may ever be
};

// The names that stand for them in log lines, as Enum2String gives them.
template <>
KiEnum2StrMap<LOG_LEVEL>::KiEnum2StrMap();
template <>
KiEnum2StrMap<LOG_CATEG>::KiEnum2StrMap();

// Appends one line to the log file of LogType: local time, process id (and thread id, from a thread
// other than the main one), "[szCateg][szLevel]" when both are given, the base name of szFile,
// LineNo and szFunc, then the message. Adds no line feed: szFormat ends in one. The time carries
// milliseconds when the shared configuration says so.
//
// Writes under an exclusive lock on the file, waiting up to 120 seconds for it, so the lines of all
// threads and processes stay whole and in the order of their times. The file is opened for this
// call alone and created (mode 0666 less the umask) when missing; its directory is not. A line that
// cannot be written is lost after one syslog record (LOG_ERR) that says why. "%m" in szFormat names
// the caller's errno, which is the same on return. Any thread may call it; thread cancellation is
// disabled meanwhile and always enabled on return.
void KiPrintf(LOG_TYPE LogType, const char* szCateg, const char* szLevel, const char* szFile,
              int LineNo, const char* szFunc, const char* szFormat, ...)
    __attribute__((format(printf, 7, 8)));

// --- The shared configuration ---

// The threshold of one process.
struct __PidDbgLevel {
  pid_t Pid;
  LOG_LEVEL Level;
};

// Decides what is logged, in all processes of the package at once. It lies in a System V shared
// memory segment that one of them creates (key KiShmDbgLogIPCKey(), at least sizeof(KiDbgLogCfg)
// bytes) and calls Init on, and that the others attach when they start. Its layout is shared by
// separately built programs: it never changes.
//
// A message is wanted when its level is at or below a threshold. Thresholds are taken as they are:
// a negative one lets nothing through, one above LOG_LEVEL_DEBUG3 everything.
//
// There is no lock. Any thread of any process may call any member: a reader sees the old or the new
// value of each field, and a new entry of the process table only when it is filled. While an entry
// is cleared, a reader may find the later ones moved or not. Processes that change the table at the
// same moment may lose one of the changes.
class KiDbgLogCfg {
 public:
  // Puts everything to its default (LOG_LEVEL_NOTICE for the categories in use, no milliseconds, an
  // empty process table), and loads the saved settings. ShmKey, the segment's key, is not needed.
  void Init(int ShmKey);

  // Load the thresholds of the categories and the switch for milliseconds from the package's
  // settings file, /var/packages/Camveld/etc/settings.conf, and save them there. What is not in the
  // file stays as it is; numbers beyond LOG_CATEG_MAX are ignored. A save keeps the file's other
  // keys, as KiFileSetVals does. The process table is not saved. Return what KiFileGetKeyVals and
  // KiFileSetVals return.
  int LoadDbgLogSettings();
  int SaveDbgLogSettings() const;

  // LOG_LEVEL_ALARM for a category outside 0 to LOG_CATEG_MAX - 1, whose threshold cannot be set.
  LOG_LEVEL GetLogLevel(LOG_CATEG Categ) const {
    return IsCateg(Categ) ? Load(m_LogLevels[Categ]) : LOG_LEVEL_ALARM;
  }
  void SetLogLevel(LOG_CATEG Categ, LOG_LEVEL Level);

  // Whether the times of log lines carry milliseconds.
  bool LogInMs() const;
  void SetLogInMs(bool blLogInMs);

  // The threshold of process Pid, LOG_LEVEL_ALARM when it has none of its own.
  LOG_LEVEL GetPidLevel(pid_t Pid) const {
    return Load(m_PidCnt) == 0 ? LOG_LEVEL_ALARM : FindPidLevel(Pid);
  }

  // Gets entry Idx of the process table, counted from 0 in the order in which they were added.
  // Returns 0, or -1 with Pid and Level as they were when there is no such entry.
  int GetPidLevel(int Idx, pid_t& Pid, LOG_LEVEL& Level) const;

  // The table holds 64 processes: a new one beyond them is not taken in.
  void SetPidLevel(pid_t Pid, LOG_LEVEL Level);
  void ClearPid(pid_t Pid);

 private:
  static constexpr int MAX_PIDS = 64;
  struct Layout;

  static bool IsCateg(LOG_CATEG Categ) { return Categ >= 0 && Categ < LOG_CATEG_MAX; }

  // Other processes read and write meanwhile: each access is one that the compiler can neither
  // split nor leave out.
  template <typename T>
  static T Load(const T& Field) {
    return __atomic_load_n(&Field, __ATOMIC_RELAXED);
  }
  template <typename T>
  static void Store(T& Field, T Value) {
    __atomic_store_n(&Field, Value, __ATOMIC_RELAXED);
  }

  LOG_LEVEL FindPidLevel(pid_t Pid) const;
  int UsedPids() const;
  int FindPid(pid_t Pid, int Count) const;
  void SetUsedPids(int Count);

  uint8_t m_blLogInMs;  // a bool, whatever byte another process may have left there
  LOG_LEVEL m_LogLevels[LOG_CATEG_MAX];
  int32_t m_PidCnt;
  __PidDbgLevel m_PidLevels[MAX_PIDS];
};

struct KiDbgLogCfg::Layout {
  static_assert(sizeof(LOG_LEVEL) == 4 && sizeof(__PidDbgLevel) == 8 && sizeof(KiDbgLogCfg) == 2568,
                "sizes are shared with other programs");
  static_assert(offsetof(__PidDbgLevel, Pid) == 0 && offsetof(__PidDbgLevel, Level) == 4 &&
                    offsetof(KiDbgLogCfg, m_blLogInMs) == 0 &&
                    offsetof(KiDbgLogCfg, m_LogLevels) == 4 &&
                    offsetof(KiDbgLogCfg, m_PidCnt) == 2052 &&
                    offsetof(KiDbgLogCfg, m_PidLevels) == 2056,
                "offsets are shared with other programs");
};

// The configuration, null while none is attached: before main, when there was no segment or no
// permission for it at the start, and after exit. Threads that are left running while the process
// exits must not log any more.
extern KiDbgLogCfg* g_pDbgLogCfg;

// The System V key of its segment.
int KiShmDbgLogIPCKey();

// Attaches the segment. Null when there is none or it may not be read and written.
KiDbgLogCfg* KiShmDbgLogCfgAt();

// Attach the configuration to g_pDbgLogCfg, and detach it. A program that links the library does
// not call them: they run by themselves, the one before main, after the program's global objects
// are constructed, the other at normal exit, after they are destroyed.
//
// Two programs are exceptions. One that is linked to the shared library without kimodule_start has
// to call both. In one that names the library's object files before its own, InitDbgCfg runs before
// the global objects are constructed.
void InitDbgCfg();
void FreeDbgCfg();

// --- The logging gate ---

// The process id that the gate goes by, 0 until it first needs it. A child of fork keeps its
// parent's.
extern pid_t g_DbgLogPid;

// Whether the category's threshold lets Level through. Everything passes while no configuration is
// attached.
inline bool ChkLogLevel(LOG_CATEG Categ, LOG_LEVEL Level) {
  const KiDbgLogCfg* pCfg = g_pDbgLogCfg;
  return pCfg == nullptr || pCfg->GetLogLevel(Categ) >= Level;
}

// Whether the process's own threshold lets Level through. Only while a configuration is attached.
inline bool ChkPidLevel(LOG_LEVEL Level) {
  pid_t Pid = __atomic_load_n(&g_DbgLogPid, __ATOMIC_RELAXED);
  if (Pid == 0) {
    Pid = getpid();
    __atomic_store_n(&g_DbgLogPid, Pid, __ATOMIC_RELAXED);
  }
  return g_pDbgLogCfg->GetPidLevel(Pid) >= Level;
}

// Logs a message under Categ and Level if the gate lets it through, with the caller's file, line
// and function: KIDBGLOG(LOG_CATEG_UTILS, LOG_LEVEL_ERROR, "Failed to open [%s]\n", szFile). What
// follows the level is evaluated only if it does, before anything else can change errno; Categ and
// Level are evaluated more than once.
#define KIDBGLOG(Categ, Level, ...)                                         \
  do {                                                                      \
    if (ChkLogLevel(Categ, Level) || ChkPidLevel(Level)) {                  \
      KiDbgPrintf(Categ, Level, __FILE__, __LINE__, __func__, __VA_ARGS__); \
    }                                                                       \
  } while (0)

// What KIDBGLOG writes with: KiPrintf to KI_LOG under the names of Categ and Level, except that it
// leaves the thread's cancellation state as it was.
void KiDbgPrintf(LOG_CATEG Categ, LOG_LEVEL Level, const char* szFile, int LineNo,
                 const char* szFunc, const char* szFormat, ...)
    __attribute__((format(printf, 6, 7)));

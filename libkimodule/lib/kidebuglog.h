// The package's log. One call appends one line to a log file that all processes of the package
// share. A shared configuration decides which messages are written.
#pragma once

#include <sys/types.h>
#include <unistd.h>

#include <cstddef>
#include <cstdint>

#include "enumtostr.h"

// The log file of a line.
enum LOG_TYPE : int {
  KI_LOG = 0,            // /var/log/camveld/camveld.log
  NOTIFICATION_LOG = 1,  // /var/log/camveld/kinotification.log
};

// Severity; lower values are more severe.
enum LOG_LEVEL : int {
  LOG_LEVEL_ALARM = 0,
  LOG_LEVEL_ERROR = 1,
  LOG_LEVEL_WARN = 2,
  LOG_LEVEL_NOTICE = 3,
  LOG_LEVEL_INFO = 4,
  LOG_LEVEL_DEBUG = 5,
  LOG_LEVEL_DEBUG2 = 6,
  LOG_LEVEL_DEBUG3 = 7,
  LOG_LEVEL_TOTAL = 8,  // number of levels
};

// The component of the package that a message comes from.
enum LOG_CATEG : int {
#define LOG_CATEG_ENTRY(Categ, Value, szName) Categ = (Value),
#include "logcateg.def"
  LOG_CATEG_TOTAL = 88,  // number of categories in use
  LOG_CATEG_MAX = 512,   // maximum number of categories
};

// Their names in log lines, for Enum2String.
template <>
KiEnum2StrMap<LOG_LEVEL>::KiEnum2StrMap();
template <>
KiEnum2StrMap<LOG_CATEG>::KiEnum2StrMap();

// Appends one line to the log file of LogType: local time, process id (and thread id, in a thread
// other than the main one), "[szCateg][szLevel]" if both are given, the base name of szFile, LineNo
// and szFunc, then the message. Adds no line feed: szFormat must end in one. The time includes
// milliseconds if the shared configuration says so.
//
// Writes under an exclusive lock on the file, for which it waits up to 120 seconds, so that the
// lines of all threads and processes are whole and in the order of their times. Opens the file for
// this call only. Creates the file (mode 0666 less the umask) if it is missing, but not its
// directory. If the file cannot be opened or locked, the line is lost and one syslog record
// (LOG_ERR) gives the reason. A write error is not reported. "%m" in szFormat gives the caller's
// errno, which the call keeps. Any thread may call it. Thread cancellation is disabled meanwhile
// and always enabled on return.
void KiPrintf(LOG_TYPE LogType, const char* szCateg, const char* szLevel, const char* szFile,
              int LineNo, const char* szFunc, const char* szFormat, ...)
    __attribute__((format(printf, 7, 8)));

// --- The shared configuration ---

// The threshold of one process.
struct __PidDbgLevel {
  pid_t Pid;
  LOG_LEVEL Level;
};

// Decides what all processes of the package log. The object is in a System V shared memory segment
// (key KiShmDbgLogIPCKey(), at least sizeof(KiDbgLogCfg) bytes). One process creates the segment
// and calls Init; the others attach the segment when they start. Separately built programs share
// the layout, so it never changes.
//
// A message is written if its level is at or below the threshold of its category or of the process.
// Any number is a valid threshold: a negative one lets nothing through, one above LOG_LEVEL_DEBUG3
// everything.
//
// There is no lock. Any thread of any process may call any member. A reader sees the old or the new
// value of each field, and a new entry of the process table only after it is filled. While an entry
// is being cleared, a reader may find each later entry moved or not. If two processes change the
// table at the same time, one of the changes may be lost.
class KiDbgLogCfg {
 public:
  // Sets everything to its default (LOG_LEVEL_NOTICE for the categories in use, no milliseconds, an
  // empty process table), then loads the saved settings. Ignores ShmKey, the segment's key.
  void Init(int ShmKey);

  // Does nothing: the object owns nothing. Whoever created the segment removes it.
  void Free();

  // Load the thresholds of the categories and the switch for milliseconds from the package's
  // settings file, /var/packages/Camveld/etc/settings.conf, or save them there. Loading leaves a
  // setting unchanged if it is not in the file, and ignores numbers after the first LOG_CATEG_MAX.
  // Saving keeps the file's other keys, as KiFileSetVals does. The process table is not saved.
  // Return what KiFileGetKeyVals and KiFileSetVals return.
  int LoadDbgLogSettings();
  int SaveDbgLogSettings() const;

  // The threshold of a category. Outside 0 to LOG_CATEG_MAX - 1, it is always LOG_LEVEL_ALARM.
  LOG_LEVEL GetLogLevel(LOG_CATEG Categ) const {
    return IsCateg(Categ) ? Load(m_LogLevels[Categ]) : LOG_LEVEL_ALARM;
  }
  void SetLogLevel(LOG_CATEG Categ, LOG_LEVEL Level);

  // Whether the times of log lines include milliseconds.
  bool LogInMs() const;
  void SetLogInMs(bool blLogInMs);

  // The threshold of process Pid; LOG_LEVEL_ALARM if it has none of its own.
  LOG_LEVEL GetPidLevel(pid_t Pid) const {
    return Load(m_PidCnt) == 0 ? LOG_LEVEL_ALARM : FindPidLevel(Pid);
  }

  // Gets entry Idx of the process table; entries are counted from 0 in the order of their addition.
  // Returns 0, or -1 with Pid and Level unchanged if there is no such entry.
  int GetPidLevel(int Idx, pid_t& Pid, LOG_LEVEL& Level) const;

  // Set or clear a process's threshold. The table holds 64 processes; a further one is ignored.
  void SetPidLevel(pid_t Pid, LOG_LEVEL Level);
  void ClearPid(pid_t Pid);

 private:
  static constexpr int MAX_PIDS = 64;
  struct Layout;

  static bool IsCateg(LOG_CATEG Categ) { return Categ >= 0 && Categ < LOG_CATEG_MAX; }

  // Other processes read and write at the same time. The compiler can neither split nor omit these
  // accesses.
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

  uint8_t m_blLogInMs;  // a bool; another process may store any byte
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

// The configuration. Null while none is attached: before main, after exit, and if at the start
// there was no segment or no permission for it. Threads that still run while the process exits must
// not log.
extern KiDbgLogCfg* g_pDbgLogCfg;

// The System V key of the configuration's segment.
int KiShmDbgLogIPCKey();

// Attaches the segment. Returns null if there is none or the process may not read and write it.
KiDbgLogCfg* KiShmDbgLogCfgAt();

// Attach the configuration to g_pDbgLogCfg, and detach it. A program that links the library does
// not call these functions. InitDbgCfg runs automatically before main, after the program's global
// objects are constructed. FreeDbgCfg runs automatically at normal exit, after they are destroyed.
//
// There are two exceptions. A program that links the shared library without kimodule_start must
// call both functions. If a program's link command names the library's object files before the
// program's own, InitDbgCfg runs before the global objects are constructed.
void InitDbgCfg();
void FreeDbgCfg();

// --- The logging gate ---

// The process id that the gate uses; 0 until the gate first needs it. After fork, the child keeps
// using its parent's process id, and so its parent's threshold, until it calls exec.
extern pid_t g_DbgLogPid;

// True if the category's threshold lets Level through or if no configuration is attached.
inline bool ChkLogLevel(LOG_CATEG Categ, LOG_LEVEL Level) {
  const KiDbgLogCfg* pCfg = g_pDbgLogCfg;
  return pCfg == nullptr || pCfg->GetLogLevel(Categ) >= Level;
}

// True if the process's own threshold lets Level through. Call only while a configuration is
// attached.
inline bool ChkPidLevel(LOG_LEVEL Level) {
  pid_t Pid = __atomic_load_n(&g_DbgLogPid, __ATOMIC_RELAXED);
  if (Pid == 0) {
    Pid = getpid();
    __atomic_store_n(&g_DbgLogPid, Pid, __ATOMIC_RELAXED);
  }
  return g_pDbgLogCfg->GetPidLevel(Pid) >= Level;
}

// Logs a message under Categ and Level, with the caller's file, line and function, if the gate lets
// it through: KIDBGLOG(LOG_CATEG_UTILS, LOG_LEVEL_ERROR, "Failed to open [%s]\n", szFile). The
// arguments after Level are evaluated only if the gate lets the message through, before anything
// else can change errno. Categ and Level are evaluated more than once.
#define KIDBGLOG(Categ, Level, ...)                                         \
  do {                                                                      \
    if (ChkLogLevel(Categ, Level) || ChkPidLevel(Level)) {                  \
      KiDbgPrintf(Categ, Level, __FILE__, __LINE__, __func__, __VA_ARGS__); \
    }                                                                       \
  } while (0)

// Writes the line of KIDBGLOG. Works like KiPrintf to KI_LOG with the names of Categ and Level, but
// restores the thread's cancellation state.
void KiDbgPrintf(LOG_CATEG Categ, LOG_LEVEL Level, const char* szFile, int LineNo,
                 const char* szFunc, const char* szFormat, ...)
    __attribute__((format(printf, 6, 7)));

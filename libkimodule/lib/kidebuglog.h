// The package's log: one call appends one line to a log file that all of its processes share.
#pragma once

// Which log file a line goes to.
enum LOG_TYPE : int {
  KI_LOG = 0,            // /var/log/camveld/camveld.log
  NOTIFICATION_LOG = 1,  // /var/log/camveld/kinotification.log
};

class KiDbgLogCfg;

// The debug-log configuration that all processes share, null while none is attached.
extern KiDbgLogCfg* g_pDbgLogCfg;

// Appends one line to the log file of LogType: local time, process id (and thread id, from a thread
// other than the main one), "[szCateg][szLevel]" when both are given, the base name of szFile,
// LineNo and szFunc, then the message. Adds no line feed: szFormat ends in one.
//
// Writes under an exclusive lock on the file, waiting up to 120 seconds for it, so the lines of all
// threads and processes stay whole and in the order of their times. The file is opened for this
// call alone and created (mode 0666 less the umask) when missing; its directory is not. A line that
// cannot be written is lost after one syslog record (LOG_ERR) that says why. Any thread may call
// it; thread cancellation is disabled meanwhile and always enabled on return.
void KiPrintf(LOG_TYPE LogType, const char* szCateg, const char* szLevel, const char* szFile,
              int LineNo, const char* szFunc, const char* szFormat, ...)
    __attribute__((format(printf, 7, 8)));

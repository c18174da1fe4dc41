#include "process.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <system_error>

#include "failure.h"
#include "fileops.h"

namespace {

constexpr size_t MAX_RECORD_BYTES = 65536;

[[noreturn]] void Become(const std::vector<std::string>& Arguments, int OutputFd) {
  std::vector<char*> Argv;
  Argv.reserve(Arguments.size() + 1);
  for (const std::string& strArgument : Arguments) {
    Argv.push_back(const_cast<char*>(strArgument.c_str()));
  }
  Argv.push_back(nullptr);
  dup2(open("/dev/null", O_RDONLY | O_CLOEXEC), STDIN_FILENO);
  dup2(OutputFd, STDOUT_FILENO);
  dup2(OutputFd, STDERR_FILENO);
  execvp(Argv[0], Argv.data());
  dprintf(STDERR_FILENO, "%s: %s\n", Argv[0], strerror(errno));
  _exit(127);
}

void ReadRecords(int SyslogFd, std::vector<std::string>* pRecords) {
  std::string strRecord(MAX_RECORD_BYTES, '\0');
  ssize_t Len;
  while ((Len = recv(SyslogFd, strRecord.data(), strRecord.size(), MSG_DONTWAIT)) >= 0) {
    pRecords->emplace_back(strRecord, 0, static_cast<size_t>(Len));
  }
}

// Reads until the program and all its children have closed their end of the pipe.
void Collect(int OutputFd, int SyslogFd, CommandResult* pResult) {
  char rgBuf[16384];
  while (true) {
    pollfd rgPoll[] = {{OutputFd, POLLIN, 0}, {SyslogFd, POLLIN, 0}};
    if (poll(rgPoll, 2, -1) == -1 && errno != EINTR) {
      throw SystemFailure("poll");
    }
    ReadRecords(SyslogFd, &pResult->Records);
    if (rgPoll[0].revents == 0) {
      continue;
    }
    const ssize_t Len = read(OutputFd, rgBuf, sizeof(rgBuf));
    if (Len == 0) {
      return;
    }
    pResult->strOutput.append(rgBuf, static_cast<size_t>(Len > 0 ? Len : 0));
  }
}

// Waits until every process that holds the other end of the pipe has ended.
[[noreturn]] void CleanUp(const int* rgPipe, const std::string& strDir) {
  close(rgPipe[1]);
  char Byte;
  while (read(rgPipe[0], &Byte, 1) == -1 && errno == EINTR) {
  }
  std::error_code Ignored;
  std::filesystem::remove_all(strDir, Ignored);
  _exit(0);
}

}  // namespace

WorkDirectory::WorkDirectory() {
  const char* szTmpDir = getenv("TMPDIR");
  const std::string strTmpDir = szTmpDir == nullptr || *szTmpDir == '\0' ? "/tmp" : szTmpDir;
  m_strName = std::filesystem::absolute(strTmpDir + "/tessel-preview.XXXXXX");
  // The cleaner keeps all signals blocked. None may end this process before there is a cleaner.
  sigset_t All;
  sigset_t Before;
  sigfillset(&All);
  sigprocmask(SIG_SETMASK, &All, &Before);
  if (mkdtemp(m_strName.data()) == nullptr) {
    throw SystemFailure("cannot make a directory in " + strTmpDir);
  }
  int rgPipe[2];
  if (pipe(rgPipe) != 0 || (m_Cleaner = fork()) == -1) {
    {
      const fileops::ErrnoKeeper Errno;
      rmdir(m_strName.c_str());
    }
    throw SystemFailure("cannot start a process");
  }
  if (m_Cleaner == 0) {
    CleanUp(rgPipe, m_strName);
  }
  close(rgPipe[0]);
  m_PipeFd = rgPipe[1];  // programs inherit it
  sigprocmask(SIG_SETMASK, &Before, nullptr);
}

WorkDirectory::~WorkDirectory() {
  close(m_PipeFd);
  while (waitpid(m_Cleaner, nullptr, 0) == -1 && errno == EINTR) {
  }
}

CommandResult RunCommand(const std::vector<std::string>& Arguments, int SyslogFd) {
  int rgPipe[2];
  if (pipe2(rgPipe, O_CLOEXEC) != 0) {
    throw SystemFailure("pipe");
  }
  const fileops::Descriptor Read(rgPipe[0]);
  fileops::Descriptor Write(rgPipe[1]);
  signal(SIGCHLD, SIG_DFL);  // if it were ignored, there would be no status
  const pid_t Parent = getpid();
  const pid_t Child = fork();
  if (Child == -1) {
    throw SystemFailure("cannot start a process");
  }
  if (Child == 0) {
    prctl(PR_SET_PDEATHSIG, SIGKILL);
    if (getppid() != Parent) {  // it has ended already
      _exit(1);
    }
    Become(Arguments, Write.Get());
  }
  Write.Close();
  CommandResult Result;
  Result.Pid = Child;
  Collect(Read.Get(), SyslogFd, &Result);
  int Status = 0;
  while (waitpid(Child, &Status, 0) == -1 && errno == EINTR) {
  }
  Result.Status = WIFEXITED(Status) ? WEXITSTATUS(Status) : 128 + WTERMSIG(Status);
  return Result;
}

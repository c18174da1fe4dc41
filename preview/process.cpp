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

// Starts a child that dies with this process. Returns 0 in the child, else its id. Throws Failure.
pid_t Fork() {
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
  }
  return Child;
}

// Blocks and returns SIGCHLD and the signals that would end this process.
sigset_t BlockSignals() {
  sigset_t Signals;
  sigemptyset(&Signals);
  for (const int Signal : {SIGINT, SIGTERM, SIGHUP, SIGQUIT, SIGPIPE, SIGALRM, SIGUSR1, SIGUSR2}) {
    struct sigaction Action;
    if (sigaction(Signal, nullptr, &Action) == 0 && Action.sa_handler != SIG_IGN) {
      sigaddset(&Signals, Signal);
    }
  }
  signal(SIGCHLD, SIG_DFL);
  sigaddset(&Signals, SIGCHLD);
  sigprocmask(SIG_BLOCK, &Signals, nullptr);
  return Signals;
}

// Waits for the child to end, and kills it if a signal arrives. Returns the signal that ended it or
// arrived; 0 if there was none.
int WaitForChild(pid_t Child, const sigset_t& Signals, int* pStatus) {
  int Caught = 0;
  while (waitpid(Child, pStatus, WNOHANG) != Child) {
    int Signal = 0;
    sigwait(&Signals, &Signal);
    if (Signal != SIGCHLD) {
      Caught = Signal;
      kill(Child, SIGKILL);
    }
  }
  // Descendants of the child die with it and become children of this process. Some emulators do
  // not hand them over.
  while (wait(nullptr) != -1 || errno == EINTR) {
  }
  return Caught == 0 && WIFSIGNALED(*pStatus) ? WTERMSIG(*pStatus) : Caught;
}

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

}  // namespace

int RunSupervised(const std::function<int(const std::string& strWorkDir)>& Work) {
  const char* szTmpDir = getenv("TMPDIR");
  const std::string strTmpDir = szTmpDir == nullptr || *szTmpDir == '\0' ? "/tmp" : szTmpDir;
  sigset_t Before;
  sigprocmask(SIG_SETMASK, nullptr, &Before);
  const sigset_t Signals = BlockSignals();
  prctl(PR_SET_CHILD_SUBREAPER, 1);
  std::string strDir = std::filesystem::absolute(strTmpDir + "/tessel-preview.XXXXXX");
  if (mkdtemp(strDir.data()) == nullptr) {
    throw SystemFailure("cannot make a directory in " + strTmpDir);
  }
  const pid_t Child = Fork();
  if (Child == 0) {
    sigprocmask(SIG_SETMASK, &Before, nullptr);
    exit(Work(strDir));
  }
  int Status = 0;
  const int Signal = WaitForChild(Child, Signals, &Status);
  std::error_code Ignored;
  std::filesystem::remove_all(strDir, Ignored);
  sigprocmask(SIG_SETMASK, &Before, nullptr);
  if (Signal != 0) {
    raise(Signal);
  }
  return WIFEXITED(Status) ? WEXITSTATUS(Status) : 2;
}

CommandResult RunCommand(const std::vector<std::string>& Arguments, int SyslogFd) {
  int rgPipe[2];
  if (pipe2(rgPipe, O_CLOEXEC) != 0) {
    throw SystemFailure("pipe");
  }
  const fileops::Descriptor Read(rgPipe[0]);
  fileops::Descriptor Write(rgPipe[1]);
  const pid_t Child = Fork();
  if (Child == 0) {
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

#include "command.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>

#include "failure.h"
#include "files.h"

namespace {

constexpr size_t MAX_RECORD_BYTES = 65536;

[[noreturn]] void Become(const std::vector<std::string>& Arguments, int OutputFd) {
  std::vector<char*> Argv;
  Argv.reserve(Arguments.size() + 1);
  for (const std::string& strArgument : Arguments) {
    Argv.push_back(const_cast<char*>(strArgument.c_str()));
  }
  Argv.push_back(nullptr);
  const int Null = open("/dev/null", O_RDONLY | O_CLOEXEC);
  dup2(Null, STDIN_FILENO);
  dup2(OutputFd, STDOUT_FILENO);
  dup2(OutputFd, STDERR_FILENO);
  prctl(PR_SET_PDEATHSIG, SIGKILL);
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
    if (SyslogFd != -1) {
      ReadRecords(SyslogFd, &pResult->Records);
    }
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

CommandResult RunCommand(const std::vector<std::string>& Arguments, int SyslogFd) {
  int rgPipe[2];
  if (pipe2(rgPipe, O_CLOEXEC) != 0) {
    throw SystemFailure("pipe");
  }
  const Descriptor Read(rgPipe[0]);
  Descriptor Write(rgPipe[1]);
  const pid_t Child = fork();
  if (Child == -1) {
    throw SystemFailure("cannot start " + Arguments[0]);
  }
  if (Child == 0) {
    Become(Arguments, Write.Get());
  }
  Write.Close();
  CommandResult Result;
  Collect(Read.Get(), SyslogFd, &Result);
  int Status = 0;
  while (waitpid(Child, &Status, 0) == -1 && errno == EINTR) {
  }
  Result.Status = WIFEXITED(Status) ? WEXITSTATUS(Status) : 128 + WTERMSIG(Status);
  return Result;
}

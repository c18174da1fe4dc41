#include "capfiles.h"

#include <fcntl.h>
#include <sys/stat.h>

#include "command.h"
#include "failure.h"
#include "files.h"

void CopyCapFiles(const std::string& strFrom, const std::string& strTo) {
  for (const std::string& strName : ListDirectory(strFrom)) {
    const std::string strFile = FileIn(strFrom, strName);
    struct stat Stat;
    if (stat(strFile.c_str(), &Stat) == 0 && S_ISREG(Stat.st_mode)) {
      const Descriptor File(OpenFile(strFile, O_RDONLY | O_NONBLOCK));
      CopyTo(File.Get(), strFile, FileIn(strTo, strName), 0600);
    }
  }
}

std::vector<std::string> ChangedFiles(const std::string& strBefore, const std::string& strAfter) {
  std::vector<std::string> Changed;
  for (const std::string& strName : ListDirectory(strBefore)) {
    if (ReadWholeFile(FileIn(strBefore, strName)) != ReadWholeFile(FileIn(strAfter, strName))) {
      Changed.push_back(strName);
    }
  }
  return Changed;
}

std::string Diff(const std::vector<std::string>& Options, const std::string& strFrom,
                 const std::string& strTo) {
  std::vector<std::string> Command = {"diff", "--unified", "--text"};
  Command.insert(Command.end(), Options.begin(), Options.end());
  Command.insert(Command.end(), {strFrom, strTo});
  const CommandResult Result = RunCommand(Command);
  if (Result.Status != 1) {
    throw Failure("cannot compare capability files: " +
                  Result.strOutput.substr(0, Result.strOutput.find('\n')));
  }
  return Result.strOutput;
}

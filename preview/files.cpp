#include "files.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <memory>

#include "failure.h"

namespace {

constexpr size_t CHUNK_BYTES = size_t{256} * 1024;

struct DirCloser {
  void operator()(DIR* pDir) const { closedir(pDir); }
};

// Reads at most Size bytes. Returns 0 at the end of the file.
size_t ReadSome(int Fd, const std::string& strFile, char* pBuf, size_t Size) {
  ssize_t Len;
  do {
    Len = read(Fd, pBuf, Size);
  } while (Len == -1 && errno == EINTR);
  if (Len == -1) {
    throw SystemFailure("cannot read " + strFile);
  }
  return static_cast<size_t>(Len);
}

void WriteAll(int Fd, const std::string& strFile, const char* pBytes, size_t Size) {
  for (size_t Done = 0; Done < Size;) {
    const ssize_t Written = write(Fd, pBytes + Done, Size - Done);
    if (Written == -1 && errno != EINTR) {
      throw SystemFailure("cannot write " + strFile);
    }
    Done += static_cast<size_t>(std::max<ssize_t>(Written, 0));
  }
}

}  // namespace

void Descriptor::Close() {
  if (m_Fd != -1) {
    close(m_Fd);
    m_Fd = -1;
  }
}

int OpenFile(const std::string& strFile, int Flags, mode_t Mode) {
  const int Fd = open(strFile.c_str(), Flags | O_CLOEXEC, Mode);
  if (Fd == -1) {
    throw SystemFailure("cannot open " + strFile);
  }
  return Fd;
}

bool Exists(const std::string& strFile) {
  struct stat Stat;
  return lstat(strFile.c_str(), &Stat) == 0;
}

bool IsDirectory(const std::string& strFile) {
  struct stat Stat;
  return stat(strFile.c_str(), &Stat) == 0 && S_ISDIR(Stat.st_mode);
}

std::vector<std::string> ListDirectory(const std::string& strDir) {
  const std::unique_ptr<DIR, DirCloser> pDir(opendir(strDir.c_str()));
  if (pDir == nullptr) {
    throw SystemFailure("cannot read the directory " + strDir);
  }
  std::vector<std::string> Names;
  errno = 0;
  while (const dirent* pEntry = readdir(pDir.get())) {
    const std::string strName = pEntry->d_name;
    if (strName != "." && strName != "..") {
      Names.push_back(strName);
    }
  }
  if (errno != 0) {
    throw SystemFailure("cannot read the directory " + strDir);
  }
  std::sort(Names.begin(), Names.end());
  return Names;
}

std::string ReadWholeFile(const std::string& strFile) {
  const Descriptor File(OpenFile(strFile, O_RDONLY));
  std::string strText;
  std::vector<char> Buf(CHUNK_BYTES);
  while (const size_t Len = ReadSome(File.Get(), strFile, Buf.data(), Buf.size())) {
    strText.append(Buf.data(), Len);
  }
  return strText;
}

void WriteFile(const std::string& strFile, const std::string& strText) {
  const Descriptor File(OpenFile(strFile, O_WRONLY | O_CREAT | O_EXCL, 0600));
  WriteAll(File.Get(), strFile, strText.data(), strText.size());
}

void CopyTo(int From, const std::string& strFrom, const std::string& strTo, mode_t Mode) {
  const Descriptor To(OpenFile(strTo, O_WRONLY | O_CREAT | O_EXCL, Mode));
  if (lseek(From, 0, SEEK_SET) == -1) {
    throw SystemFailure("cannot read " + strFrom);
  }
  std::vector<char> Buf(CHUNK_BYTES);
  while (const size_t Len = ReadSome(From, strFrom, Buf.data(), Buf.size())) {
    WriteAll(To.Get(), strTo, Buf.data(), Len);
  }
}

void SyncFile(const std::string& strFile) {
  const Descriptor File(OpenFile(strFile, O_RDONLY));
  if (fsync(File.Get()) != 0) {
    throw SystemFailure("cannot sync " + strFile);
  }
}

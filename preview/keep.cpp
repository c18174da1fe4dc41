#include "keep.h"

#include <fcntl.h>
#include <sys/sendfile.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <filesystem>

#include "failure.h"

namespace fs = std::filesystem;

namespace {

constexpr size_t CHUNK_BYTES = size_t{1} << 20;

int OpenDirectory(const std::string& strDir) {
  const int Fd = open(strDir.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (Fd == -1) {
    throw fs::is_symlink(strDir) ? Failure(strDir + " is a link; name the directory itself")
                                 : SystemFailure("cannot open the directory " + strDir);
  }
  return Fd;
}

// Returns 0, or -1 with errno.
int CopyContent(int From, int To) {
  ssize_t Len;
  do {
    Len = sendfile(To, From, nullptr, CHUNK_BYTES);
  } while (Len > 0 || (Len == -1 && errno == EINTR));
  return static_cast<int>(Len);
}

}  // namespace

KeptFile::KeptFile(const std::string& strFile)
    : m_strFile(strFile),
      m_strName(fs::path(strFile).filename()),
      m_Dir(OpenDirectory(fs::path(strFile).parent_path())) {
  struct stat Stat;
  if (fstat(m_Dir.Get(), &Stat) != 0) {
    throw SystemFailure("cannot examine the directory of " + strFile);
  }
  const bool blOwn = Stat.st_uid == geteuid() || Stat.st_uid == 0;
  if (!blOwn || (Stat.st_mode & (S_IWGRP | S_IWOTH)) != 0) {
    throw Failure("others can write the directory of " + strFile);
  }
  if (m_strName.empty() ||
      fstatat(m_Dir.Get(), m_strName.c_str(), &Stat, AT_SYMLINK_NOFOLLOW) == 0) {
    throw Failure(strFile + (m_strName.empty() ? " is a directory" : " exists already"));
  }
}

void KeptFile::Keep(const std::string& strFrom) {
  // A killed preview may have left such a file. Nobody else can make one here.
  const std::string strPart = m_strName + ".part";
  unlinkat(m_Dir.Get(), strPart.c_str(), 0);
  const fileops::Descriptor From(open(strFrom.c_str(), O_RDONLY | O_CLOEXEC));
  fileops::Descriptor To(
      openat(m_Dir.Get(), strPart.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600));
  if (To.Get() == -1 || CopyContent(From.Get(), To.Get()) != 0 || fsync(To.Get()) != 0 ||
      To.Close() != 0 ||
      renameat(m_Dir.Get(), strPart.c_str(), m_Dir.Get(), m_strName.c_str()) != 0 ||
      // EINVAL: this file system cannot sync a directory.
      (fsync(m_Dir.Get()) != 0 && errno != EINVAL)) {
    const std::string strReason = SystemFailure("cannot write " + m_strFile).what();
    unlinkat(m_Dir.Get(), strPart.c_str(), 0);
    unlinkat(m_Dir.Get(), m_strName.c_str(), 0);
    throw Failure(strReason);
  }
}

// Files, directories and descriptors. All functions throw Failure, with the file's name.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

// Owns a descriptor. -1 means none.
class Descriptor {
 public:
  explicit Descriptor(int Fd = -1) : m_Fd(Fd) {}
  ~Descriptor() { Close(); }
  Descriptor(const Descriptor&) = delete;
  Descriptor& operator=(const Descriptor&) = delete;
  int Get() const { return m_Fd; }
  void Close();

 private:
  int m_Fd;
};

// Opens a file, with O_CLOEXEC added to the flags.
int OpenFile(const std::string& strFile, int Flags, mode_t Mode = 0);

bool Exists(const std::string& strFile);
bool IsDirectory(const std::string& strFile);

// Returns the path of a file in a directory.
inline std::string FileIn(const std::string& strDir, const std::string& strName) {
  return strDir + "/" + strName;
}

// Returns the names in a directory without "." and "..", sorted by their bytes.
std::vector<std::string> ListDirectory(const std::string& strDir);

std::string ReadWholeFile(const std::string& strFile);

// Creates a file with this text.
void WriteFile(const std::string& strFile, const std::string& strText);

// Copies the file behind From, from its start, to the new file strTo. Messages call it strFrom.
void CopyTo(int From, const std::string& strFrom, const std::string& strTo, mode_t Mode);

void SyncFile(const std::string& strFile);

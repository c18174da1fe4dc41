// Files, directories and descriptors. All functions throw Failure, with the file's name.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

// Owns a descriptor, or none (-1).
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

// Opens a file; O_CLOEXEC is added to the flags.
int OpenFile(const std::string& strFile, int Flags, mode_t Mode = 0);

bool Exists(const std::string& strFile);
bool IsDirectory(const std::string& strFile);

// The name of a file in a directory.
inline std::string FileIn(const std::string& strDir, const std::string& strName) {
  return strDir + "/" + strName;
}

// The names in a directory but "." and "..", in the order of their bytes.
std::vector<std::string> ListDirectory(const std::string& strDir);

std::string ReadWholeFile(const std::string& strFile);

// Creates a file of that text.
void WriteFile(const std::string& strFile, const std::string& strText);

// Copies what the descriptor reads from its start to a new file.
void CopyTo(int From, const std::string& strFrom, const std::string& strTo, mode_t Mode);

void SyncFile(const std::string& strFile);

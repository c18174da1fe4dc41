// Puts a finished file where it is kept.
#pragma once

#include <string>

#include "fileops.h"

// A new file in a directory that only its owner and root can write.
class KeptFile {
 public:
  // Refuses a file that exists, and a directory that is a link or that others can write: there,
  // they could put something else in its place. Throws Failure, as Keep does.
  explicit KeptFile(const std::string& strFile);

  // Copies the content of strFrom into the file (mode 0600). The file gets its name when it is
  // complete and on stable storage.
  void Keep(const std::string& strFrom);

 private:
  const std::string m_strFile;
  const std::string m_strName;  // in the directory
  const fileops::Descriptor m_Dir;
};

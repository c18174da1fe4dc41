// Capability files: text files in one directory.
#pragma once

#include <string>
#include <vector>

// Copies the regular files of a directory, and those that its links lead to: nothing else can hold
// keys. Throws Failure, as the others do.
void CopyCapFiles(const std::string& strFrom, const std::string& strTo);

// The names of files whose text differs between two directories.
std::vector<std::string> ChangedFiles(const std::string& strBefore, const std::string& strAfter);

// Runs diff(1) with further options on two files.
std::string Diff(const std::vector<std::string>& Options, const std::string& strFrom,
                 const std::string& strTo);

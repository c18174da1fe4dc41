// Capability files: text files in one directory.
#pragma once

#include <string>
#include <vector>

// Copies the regular files of a directory, and those that its links point to. Only they can contain
// keys. All functions here throw Failure.
void CopyCapFiles(const std::string& strFrom, const std::string& strTo);

// Returns the names of the files whose text differs between two directories.
std::vector<std::string> ChangedFiles(const std::string& strBefore, const std::string& strAfter);

// Returns what diff(1) prints for two files. Options are added to its own.
std::string Diff(const std::vector<std::string>& Options, const std::string& strFrom,
                 const std::string& strTo);

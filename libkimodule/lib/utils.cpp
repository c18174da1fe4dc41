#include "utils.h"

std::string GetBaseName(const std::string& strFullPath) {
  // npos + 1 is 0: without a separator the whole path is its own base name.
  return strFullPath.substr(strFullPath.find_last_of("/\\") + 1);
}

std::string itos(int64_t i) { return std::to_string(i); }

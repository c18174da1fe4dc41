// Small, stateless helpers shared by the package's processes. All may be called from any thread.
#pragma once

#include <cstdint>
#include <string>

// The part of strFullPath after its last '/' or '\', or all of it when it has neither.
std::string GetBaseName(const std::string& strFullPath);

// The decimal text of i.
std::string itos(int64_t i);

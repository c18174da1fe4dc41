// Key-value files: what was written reads back, and rewriting twice is rewriting once.

#include "check.h"
#include "fileutils.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* pData, size_t Size) {
  FuzzedDataProvider Input(pData, Size);
  const std::string strKey = Input.ConsumeRandomLengthString(9);
  const std::string strVal = Input.ConsumeRandomLengthString(9);
  std::map<std::string, std::string> Before;
  std::map<std::string, std::string> After;
  WriteFile(Input.ConsumeRemainingBytesAsString());
  const int Lines = KiFileGetAllKeyVals(FILE_NAME, Before);
  CHECK(Lines >= static_cast<int>(Before.size()));
  if (strKey.find_first_of("=\n") != std::string::npos || strVal.find('\n') != std::string::npos) {
    return 0;
  }
  CHECK(KiFileSetVals(FILE_NAME, {{strKey, strVal}}, true) == 0);
  const std::string strOnce = ReadFile();
  CHECK(KiFileSetVals(FILE_NAME, {{strKey, strVal}}, true) == 0);
  CHECK(ReadFile() == strOnce);
  KiFileGetAllKeyVals(FILE_NAME, After);
  Before[strKey] = strVal;
  CHECK(After == Before);
  CHECK(KiFileRemoveKeys(FILE_NAME, {strKey}) == 0);
  CHECK(KiFileGetAllKeyVals(FILE_NAME, After) == static_cast<int>(Before.size()) - 1);
  CHECK(After.count(strKey) == 0);
  return 0;
}

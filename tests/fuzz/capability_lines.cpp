// Capability files: a key reads back, and every byte of the other lines stays.

#include "check.h"
#include "zamoc.h"

static int Set(const std::string& strVal) {
  return ZAMOCFileSetKeyValue(FILE_NAME, "key", strVal.c_str(), "%s=%s\n");
}

static std::string Get() {
  char szValue[64];
  ZAMOCFileGetKeyValue(FILE_NAME, "key", szValue, sizeof(szValue), 0);
  return szValue;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* pData, size_t Size) {
  FuzzedDataProvider Input(pData, Size);
  std::string strVal = Input.ConsumeRandomLengthString(9);
  const std::string strText = Input.ConsumeRemainingBytesAsString();
  WriteFile(strText);
  const int Removed = ZAMOCFileRemoveKey(FILE_NAME, "key");
  std::string strOthers = ReadFile();
  CHECK(Get().empty());
  CHECK(Removed == (strOthers == strText ? 0 : 1));
  CHECK(ZAMOCFileRemoveKey(FILE_NAME, "key") == 0);
  strVal.resize(std::min(strVal.size(), strVal.find_first_of(" \t\r\n\"\0"s)));
  CHECK(Set(strVal) == 0);
  strOthers += strOthers.empty() || strOthers.back() == '\n' ? "" : "\n";
  CHECK(ReadFile() == strOthers + "key=" + strVal + "\n");
  WriteFile(strText);
  CHECK(Set(strVal) == 0);
  CHECK(Get() == strVal);
  const std::string strOnce = ReadFile();
  CHECK(Set(strVal) == 0);
  CHECK(ReadFile() == strOnce);
  return 0;
}

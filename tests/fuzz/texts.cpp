// The helpers for texts: a decoder undoes each encoder, and a second time changes nothing.

#include <memory>

#include "check.h"
#include "utils.h"

static std::string DecodeUrl(const std::string& strUrl) {
  std::string strText;
  for (size_t Pos = 0; Pos < strUrl.size(); ++Pos) {
    const bool blEncoded = strUrl[Pos] == '%';
    strText += blEncoded ? static_cast<char>(Hex2Dec(&strUrl[Pos + 1], 2)) : strUrl[Pos];
    Pos += blEncoded ? 2 : 0;
  }
  return strText;
}

static std::string DecodeBase64(const std::string& strBase64) {
  static const std::string DIGITS =
      "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  std::string strText;
  size_t Bits = 0;
  int Count = 0;  // of bits that are no text yet
  for (const char Digit : strBase64.substr(0, strBase64.find('='))) {
    Bits = Bits << 6 | DIGITS.find(Digit);
    Count += 6;
    if (Count >= 8) {
      Count -= 8;
      strText += static_cast<char>(Bits >> Count);
    }
  }
  return strText;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* pData, size_t Size) {
  FuzzedDataProvider Input(pData, Size);
  const std::string strSub = Input.ConsumeRandomLengthString(5);
  const std::string strText = Input.ConsumeRemainingBytesAsString();
  if (strText.find_first_of("\t\n\v\f\r") == std::string::npos) {  // any becomes a blank
    CHECK(DecodeUrl(urlEncoding(strText, "")) == strText);
  }
  const std::unique_ptr<char, decltype(&free)> pBase64(HttpBase64Encode(strText.c_str()), free);
  CHECK(DecodeBase64(pBase64.get()) == strText.substr(0, strText.find('\0')));
  const std::string strTrimmed = Trim(strText, strSub.c_str());
  CHECK(Trim(strTrimmed, strSub.c_str()) == strTrimmed);
  String2IntVector(strText, strSub);
  return 0;
}

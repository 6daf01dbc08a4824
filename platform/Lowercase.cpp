#include "platform/Lowercase.h"

#include <unicode/bytestream.h>
#include <unicode/casemap.h>

#include <algorithm>

namespace sable::platform {
namespace {

char lowercasedASCII(char c) {
  return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c;
}

}  // namespace

std::string lowercased(std::string_view text) {
  std::string result;
  // Most of what people type needs none of ICU's tables.
  if (std::ranges::all_of(text, [](char c) { return static_cast<unsigned char>(c) < 0x80; })) {
    result.resize(text.size());
    std::ranges::transform(text, result.begin(), lowercasedASCII);
    return result;
  }
  UErrorCode status = U_ZERO_ERROR;
  icu::StringByteSink<std::string> sink(&result);
  icu::CaseMap::utf8ToLower("", 0, icu::StringPiece(text.data(), static_cast<int32_t>(text.size())), sink,
                            nullptr, status);
  return result;
}

}  // namespace sable::platform

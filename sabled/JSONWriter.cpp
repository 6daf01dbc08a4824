#include "sabled/JSONWriter.h"

#include <fmt/format.h>
#include <simdjson.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <cstring>
#include <iterator>
#include <nlohmann/json.hpp>

namespace sable {

namespace {

bool isPlain(char c) {
  return static_cast<unsigned char>(c) >= 0x20 && c != '"' && c != '\\';
}

/// Whether eight bytes are ASCII that JSON takes as it is. The highest bit of a byte is set where the byte
/// is not ASCII, or where one of the subtractions goes below 0; what they borrow shows nothing more.
bool areEightPlainASCII(const char* bytes) {
  constexpr std::uint64_t kEach = 0x0101010101010101;
  std::uint64_t word = 0;
  std::memcpy(&word, bytes, sizeof word);
  const std::uint64_t special =
      word | (word - kEach * 0x20) | ((word ^ kEach * '"') - kEach) | ((word ^ kEach * '\\') - kEach);
  return (special & kEach * 0x80) == 0;
}

/// How many bytes at the beginning are ASCII that JSON takes as it is.
std::size_t lengthOfPlainASCII(std::string_view text) {
  std::size_t length = 0;
  while (text.size() - length >= 8 && areEightPlainASCII(text.data() + length)) length += 8;
  while (length < text.size() && isPlain(text[length]) && static_cast<signed char>(text[length]) >= 0)
    ++length;
  return length;
}

void writeQuoted(std::string& text, std::string_view plain) {
  const std::size_t start = text.size() + 1;
  text.append(plain.size() + 2, '"');
  plain.copy(&text[start], plain.size());
}

void writeEscape(std::string& text, char c) {
  constexpr std::string_view kEscaped = "\"\\\b\f\n\r\t", kLetters = "\"\\bfnrt";
  if (const auto at = kEscaped.find(c); at != kEscaped.npos) {
    text += '\\';
    text += kLetters[at];
  } else {
    fmt::format_to(std::back_inserter(text), "\\u{:04x}", static_cast<unsigned char>(c));
  }
}

}  // namespace

void JSONPlace::operator=(double value) {
  if (!std::isfinite(value)) return *this = nullptr;
  std::array<char, 64> digits{};
  // The digits of compactJSON(), of which there is no other way to them than through a tree.
  text_.append(digits.data(),
               nlohmann::detail::to_chars(digits.data(), digits.data() + digits.size(), value));
}

void JSONPlace::operator=(std::string_view value) {
  const std::size_t ascii = lengthOfPlainASCII(value);
  if (ascii == value.size()) return writeQuoted(text_, value);
  if (!simdjson::validate_utf8(value)) return *this = Dictionary(value);
  text_ += '"';
  text_ += value.substr(0, ascii);
  value.remove_prefix(ascii);
  while (!value.empty()) {
    const auto plain = std::ranges::find_if_not(value, isPlain) - value.begin();
    text_ += value.substr(0, static_cast<std::size_t>(plain));
    value.remove_prefix(static_cast<std::size_t>(plain));
    if (value.empty()) break;
    writeEscape(text_, value.front());
    value.remove_prefix(1);
  }
  text_ += '"';
}

void JSONPlace::operator=(std::optional<std::string_view> value) {
  if (value) {
    *this = *value;
  } else {
    *this = nullptr;
  }
}

void JSONPlace::writeSigned(std::int64_t value) {
  const fmt::format_int digits(value);
  text_.append(digits.data(), digits.size());
}

void JSONPlace::writeUnsigned(std::uint64_t value) {
  const fmt::format_int digits(value);
  text_.append(digits.data(), digits.size());
}

JSONPlace JSONObject::operator[](std::string_view key) {
  if (text_.back() != '{') text_ += ',';
  JSONPlace{text_} = key;
  text_ += ':';
  return JSONPlace(text_);
}

JSONPlace JSONArray::next() {
  if (text_.back() != '[') text_ += ',';
  return JSONPlace(text_);
}

}  // namespace sable

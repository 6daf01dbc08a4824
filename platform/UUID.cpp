#include "platform/UUID.h"

#include <cstddef>

namespace sable {

namespace {

constexpr std::size_t kTextLength = 36;

constexpr bool hyphenAt(std::size_t position) {
  return position == 8 || position == 13 || position == 18 || position == 23;
}

std::optional<unsigned> nibble(char c) {
  if (c >= '0' && c <= '9') return static_cast<unsigned>(c - '0');
  if (c >= 'a' && c <= 'f') return static_cast<unsigned>(c - 'a' + 10);
  if (c >= 'A' && c <= 'F') return static_cast<unsigned>(c - 'A' + 10);
  return std::nullopt;
}

}  // namespace

std::string UUID::string() const {
  static constexpr char kDigits[] = "0123456789ABCDEF";
  std::string text;
  text.reserve(kTextLength);
  for (const std::uint8_t byte : bytes) {
    if (hyphenAt(text.size())) text += '-';
    text += kDigits[byte >> 4];
    text += kDigits[byte & 0x0F];
  }
  return text;
}

std::optional<UUID> UUID::parse(std::string_view text) {
  if (text.size() != kTextLength) return std::nullopt;
  UUID uuid;
  std::size_t position = 0;
  for (std::uint8_t& byte : uuid.bytes) {
    if (hyphenAt(position) && text[position++] != '-') return std::nullopt;
    const auto high = nibble(text[position++]);
    const auto low = nibble(text[position++]);
    if (!high || !low) return std::nullopt;
    byte = static_cast<std::uint8_t>(*high << 4 | *low);
  }
  return uuid;
}

}  // namespace sable

#include "platform/host/RelayFraming.h"

#include <systemd/sd-bus.h>

#include <array>
#include <cstdint>
#include <utility>

#include "platform/RelaySupport.h"

namespace sable::platform::host {

namespace {

std::uint32_t word(std::string_view bytes, bool bigEndian = false) {
  std::uint32_t value = 0;
  for (unsigned i = 0; i < 4; ++i) {
    value |= static_cast<std::uint32_t>(static_cast<unsigned char>(bytes[bigEndian ? 3 - i : i])) << 8 * i;
  }
  return value;
}

std::size_t padded(std::size_t size) {
  return (size + 7) / 8 * 8;
}

bool isZero(std::string_view bytes) {
  return bytes.find_first_not_of('\0') == std::string_view::npos;
}

bool isPlainSignature(std::string_view text) {
  while (!text.empty()) {
    if (!takeRelayType(text)) return false;
  }
  return true;
}

/// By code (D-Bus specification, "Header Fields"): the type, and what is said of a text with a NUL behind it.
struct Field {
  char type = 0;
  int (*isValid)(const char* text) = nullptr;
};
constexpr std::array<Field, 9> kFields{{{},
                                        {'o', sd_bus_object_path_is_valid},
                                        {'s', sd_bus_interface_name_is_valid},
                                        {'s', sd_bus_member_name_is_valid},
                                        {},
                                        {},
                                        {'s', sd_bus_service_name_is_valid},
                                        {},
                                        {'g', nullptr}}};
constexpr unsigned kPath = 1, kMember = 3;

bool isReserved(std::string_view text) {
  return text == "/org/freedesktop/DBus/Local" || text == "org.freedesktop.DBus.Local";
}

/// Takes one field, and the padding in front of the next one; its code, or nullopt where it is not plain.
std::optional<unsigned> takeField(std::string_view& bytes) {
  const unsigned code = static_cast<unsigned char>(bytes[0]);
  if (code >= kFields.size() || kFields[code].type == 0) return std::nullopt;
  const Field& field = kFields[code];
  const bool isText = field.isValid != nullptr;
  const std::size_t start = isText ? 8 : 5;
  if (bytes.size() <= start || bytes[1] != 1 || bytes[2] != field.type || bytes[3] != '\0')
    return std::nullopt;
  const std::size_t end = start + (isText ? word(bytes.substr(4)) : static_cast<unsigned char>(bytes[4]));
  if (end >= bytes.size() || bytes.find('\0', start) != end) return std::nullopt;
  const std::string_view text = bytes.substr(start, end - start);
  if (isReserved(text) || !(isText ? field.isValid(text.data()) > 0 : isPlainSignature(text))) {
    return std::nullopt;
  }
  bytes.remove_prefix(end + 1);
  if (bytes.empty()) return code;
  const std::size_t padding = padded(end + 1) - (end + 1);
  if (bytes.size() <= padding || !isZero(bytes.substr(0, padding))) return std::nullopt;
  bytes.remove_prefix(padding);
  return code;
}

}  // namespace

std::optional<std::size_t> relayMessageSize(std::string_view message) {
  const bool bigEndian = message[0] == 'B';
  if (!bigEndian && message[0] != 'l') return std::nullopt;
  return kRelayFixedBytes + padded(word(message.substr(12), bigEndian)) + word(message.substr(4), bigEndian);
}

bool isPlainRelayCall(std::string_view message) {
  constexpr std::string_view kPlainStart = "l\1";
  if (message.size() < kRelayFixedBytes || relayMessageSize(message) != message.size()) return false;
  if (!message.starts_with(kPlainStart) || message[3] != '\1' || word(message.substr(8)) == 0) return false;
  const std::size_t size = word(message.substr(12));
  if (!isZero(message.substr(kRelayFixedBytes + size, padded(size) - size))) return false;
  std::string_view fields = message.substr(kRelayFixedBytes, size);
  std::array<bool, kFields.size()> seen{};
  while (!fields.empty()) {
    const auto code = takeField(fields);
    if (!code || std::exchange(seen[*code], true)) return false;
  }
  return seen[kPath] && seen[kMember];
}

}  // namespace sable::platform::host

#include "platform/IPAddress.h"

#include <arpa/inet.h>

namespace sable::platform {

std::string numericAddress(std::string_view bytes) {
  if (bytes.size() != sizeof(in_addr) && bytes.size() != sizeof(in6_addr)) return {};
  char text[INET6_ADDRSTRLEN];
  const int family = bytes.size() == sizeof(in_addr) ? AF_INET : AF_INET6;
  return inet_ntop(family, bytes.data(), text, sizeof text) != nullptr ? text : "";
}

std::optional<std::string> addressBytes(const std::string& text) {
  const bool six = text.find(':') != std::string::npos;
  std::string bytes(six ? sizeof(in6_addr) : sizeof(in_addr), '\0');
  if (inet_pton(six ? AF_INET6 : AF_INET, text.c_str(), bytes.data()) != 1) return std::nullopt;
  return bytes;
}

}  // namespace sable::platform

#pragma once

#include <cstddef>
#include <memory>
#include <string_view>

#include "platform/RelayValue.h"

typedef struct sd_bus_message sd_bus_message;

/// Between RelayValues and sd-bus messages. Nothing here is thread-safe, reference counts of
/// messages included: all of it happens under the turn of the connection that owns the bus.
/// Results below 0 are errno values as sd-bus gives them.
namespace sable::platform::host {

struct ReleaseMessage {
  void operator()(sd_bus_message* message) const;
};
using RelayMessage = std::unique_ptr<sd_bus_message, ReleaseMessage>;

/// Appends to a message under construction. Strings that are not UTF-8, or hold a NUL, which D-Bus
/// has no room for, get U+FFFD in place of what is wrong.
[[nodiscard]] int appendArguments(sd_bus_message* message, const RelayArguments& arguments);

/// Reads the whole body, whose signature is `signature`, a sequence of RelayValue types. -EBADMSG
/// when the bytes break the wire format, -EMSGSIZE past `maximumBytes` of content.
[[nodiscard]] int readArguments(sd_bus_message* message, std::string_view signature, std::size_t maximumBytes,
                                RelayArguments& arguments);

}  // namespace sable::platform::host

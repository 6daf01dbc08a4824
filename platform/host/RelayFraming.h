#pragma once

#include <cstddef>
#include <optional>
#include <string_view>

/// As much of a D-Bus message as shows where it ends (D-Bus specification, "Message Format"):
///
///     byte order 1 | type 1 | flags 1 | version 1 | length of the body 4 | serial 4 | length of the fields 4
///     | fields | padding to a multiple of 8 | body
namespace sable::platform::host {

inline constexpr std::size_t kRelayFixedBytes = 16;

/// The bytes of a message whose first kRelayFixedBytes these are; nullopt when it has no known byte order.
std::optional<std::size_t> relayMessageSize(std::string_view message);

/// Whether a whole message is a call as clients make them, of whose head sd-bus will find nothing wrong.
/// Of the rest, right or wrong, it says no.
bool isPlainRelayCall(std::string_view message);

}  // namespace sable::platform::host

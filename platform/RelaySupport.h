#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Relay.h"

/// What the implementations of Relay have in common.
namespace sable::platform {

/// The alternative of RelayValue (its index) whose D-Bus type stands at the head of `signature`,
/// which loses it; nullopt when no alternative has that type.
std::optional<std::size_t> takeRelayType(std::string_view& signature);

/// "sa{sv}" for a string and a record.
std::string relaySignature(const RelayArguments& arguments);
bool relayArgumentsMatch(const RelayArguments& arguments, std::string_view signature);

/// Stops the process unless `arguments` have `signature`: what the process itself sends is its own
/// fault. `method` is for the message.
void requireRelaySignature(const RelayArguments& arguments, std::string_view signature,
                           std::string_view method);

/// Bytes that a message with these arguments takes, its header estimated: for quotas.
std::size_t relayWireSize(const RelayArguments& arguments);

/// Whether a value is left out of its record: nothing, or data that is null.
bool isAbsent(const RelayValue& value);

tl::unexpected<Error> relayError(RelayErrorCode code, std::string reason);
/// The error that calls of an ended connection get.
tl::unexpected<Error> relayDisconnected();
tl::unexpected<Error> relayTimedOut();

}  // namespace sable::platform

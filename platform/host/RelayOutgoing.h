#pragma once

#include <cstdint>
#include <string>

#include "platform/Relay.h"
#include "platform/host/RelayWire.h"

typedef struct sd_bus sd_bus;

namespace sable::platform::host {

/// A message that is still values: it can wait for its turn without touching the bus.
struct RelayOutgoing {
  enum class Kind { reply, error, call, oneWay };
  Kind kind = Kind::reply;
  /// Of the call that is answered, or this call's own.
  std::uint64_t cookie = 0;
  const RelayInterface* interface = nullptr;  ///< of a call
  const RelayMethod* method = nullptr;        ///< of a call
  RelayArguments arguments;
  std::string errorName;
  std::string errorText;
};

/// Makes the message, sealed where the cookie is ours. Under the turn of the bus's connection;
/// below 0 is an errno value.
[[nodiscard]] int makeMessage(sd_bus* bus, const RelayOutgoing& outgoing, RelayMessage& message);

}  // namespace sable::platform::host

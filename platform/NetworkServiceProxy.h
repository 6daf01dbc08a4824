#pragma once

#include <string_view>

#include "platform/Dictionary.h"
#include "platform/HTTPSession.h"

namespace sable::platform {

/// Routes tasks through the privacy proxy that hides the device's address from the service.
class NetworkServiceProxy {
 public:
  virtual ~NetworkServiceProxy() = default;

  /// Takes the configuration of a client name ({"proxy": URL, "enabled": bool}; null removes it).
  /// Fails, and keeps the old one, when it names no usable proxy.
  virtual Expected<void> setConfiguration(std::string_view clientName, const Dictionary& configuration) = 0;

  /// Whether a configured proxy is there and enabled.
  virtual bool isEnabled() const = 0;

  /// Routes a task that is not yet resumed through the proxy.
  virtual Expected<void> enable(HTTPDataTask& task) = 0;

  /// The same request, marked to go through the proxy.
  virtual HTTPRequest brambleRequest(HTTPRequest request) const = 0;
};

}  // namespace sable::platform

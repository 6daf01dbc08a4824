#pragma once

#include <map>
#include <mutex>
#include <string>

#include "platform/NetworkServiceProxy.h"

namespace sable::platform {

/// Routes tasks through the proxy that a client's configuration names. Of several enabled ones that
/// of the first client name counts. A configuration that is not enabled need not name a proxy. Any
/// thread.
class ConfiguredServiceProxy final : public NetworkServiceProxy {
 public:
  Expected<void> setConfiguration(std::string_view clientName, const Dictionary& configuration) override;
  bool isEnabled() const override;
  Expected<void> enable(HTTPDataTask& task) override;
  HTTPRequest brambleRequest(HTTPRequest request) const override;

 private:
  std::string proxyURL() const;

  mutable std::mutex mutex_;
  std::map<std::string, std::string, std::less<>> proxyURLs_;  // of the enabled ones, by client name
};

}  // namespace sable::platform

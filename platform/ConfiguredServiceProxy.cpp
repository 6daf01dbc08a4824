#include "platform/ConfiguredServiceProxy.h"

#include <nlohmann/json.hpp>

namespace sable::platform {

Expected<void> ConfiguredServiceProxy::setConfiguration(std::string_view clientName,
                                                        const Dictionary& configuration) {
  std::string proxy = stringMember(configuration, "proxy").value_or("");
  const bool enabled = booleanMember(configuration, "enabled").value_or(false);
  if (!configuration.is_null() && (enabled || !proxy.empty()) && !isProxyURL(proxy)) {
    return tl::unexpected(
        httpError(HTTPErrorCode::proxyFailed, "\"" + proxy + "\" is not the URL of a proxy"));
  }
  if (!configuration.is_null() && !configuration.is_object()) {
    return tl::unexpected(httpError(HTTPErrorCode::proxyFailed, "a proxy configuration is an object"));
  }
  const std::lock_guard lock(mutex_);
  if (enabled) {
    proxyURLs_.insert_or_assign(std::string(clientName), std::move(proxy));
  } else if (const auto found = proxyURLs_.find(clientName); found != proxyURLs_.end()) {
    proxyURLs_.erase(found);
  }
  return {};
}

std::string ConfiguredServiceProxy::proxyURL() const {
  const std::lock_guard lock(mutex_);
  return proxyURLs_.empty() ? std::string() : proxyURLs_.begin()->second;
}

bool ConfiguredServiceProxy::isEnabled() const {
  return !proxyURL().empty();
}

Expected<void> ConfiguredServiceProxy::enable(HTTPDataTask& task) {
  std::string proxy = proxyURL();
  if (proxy.empty()) {
    return tl::unexpected(httpError(HTTPErrorCode::proxyFailed, "no proxy is configured and enabled"));
  }
  task.setProxy(std::move(proxy));
  return {};
}

HTTPRequest ConfiguredServiceProxy::brambleRequest(HTTPRequest request) const {
  request.proxied = true;
  return request;
}

}  // namespace sable::platform

#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Dictionary.h"

namespace sable {

/// Product names that identify a client in identifiers, user agents and the bag's "agents", in the
/// order in which they are looked for.
inline constexpr std::string_view kSBLClientNames[] = {"rover",    "beacon", "vox",   "lookup",
                                                       "messages", "news",   "sabled"};

/// The service's configuration of one user agent; immutable, any thread. A key of the bag may also
/// stand in "agents.NAME": it holds instead of the top-level one for a user agent that contains
/// NAME in any letter case. A value of the wrong type counts as absent.
class SBLBag {
 public:
  SBLBag(std::shared_ptr<const Dictionary> dictionary, std::string userAgent);

  using Strings = std::optional<std::vector<std::string>>;

  const std::shared_ptr<const Dictionary>& rawBag() const { return rawBag_; }
  const std::string& userAgent() const { return userAgent_; }

  const std::string& version() const { return version_; }
  bool isEnabled() const { return isEnabled_; }
  bool feedbackEnabled() const { return feedbackEnabled_; }
  const std::optional<std::string>& searchURL() const { return searchURL_; }
  const std::optional<std::string>& warmURL() const { return warmURL_; }
  const std::optional<std::string>& feedbackURL() const { return feedbackURL_; }
  const std::optional<std::string>& crowdsourcingURL() const { return crowdsourcingURL_; }
  std::uint64_t minimumQueryLength() const { return minimumQueryLength_; }         ///< UTF-16 code units
  double timeoutIntervalForRequest() const { return timeoutIntervalForRequest_; }  ///< seconds
  double searchRenderTimeout() const { return searchRenderTimeout_; }              ///< seconds
  bool sendGeoEnvironmentHeader() const { return sendGeoEnvironmentHeader_; }
  const std::set<std::string>& supportedGeoLocationSources() const { return supportedGeoLocationSources_; }
  double subscriptionTTL() const { return subscriptionTTL_; }  ///< seconds
  /// {"proxy": URL, "enabled": bool}, or null when the bag has none.
  Dictionary brambleConfiguration() const;
  // Whose subscriptions may be told to the service, by web domain and by application.
  const Strings& subscriptionProviderDomainWhitelist() const { return domainWhitelist_; }
  const Strings& subscriptionProviderBundleIdentifierWhitelist() const { return bundleIdentifierWhitelist_; }
  /// The image that the service calls `identifier`.
  std::optional<std::string> urlForIdentifier(std::string_view identifier) const;

  /// One line for each known key whose value has the wrong type.
  const std::vector<std::string>& problems() const { return problems_; }

 private:
  const Dictionary* value(std::string_view key) const;
  template <class T>
  T read(std::string_view key, T absent);
  std::string readVersion();
  std::optional<std::string> readURL(std::string_view key);
  Strings readStrings(std::string_view key);
  std::set<std::string> readSet(std::string_view key);
  void reportWrongType(std::string_view key, std::string_view wanted);

  const std::shared_ptr<const Dictionary> rawBag_;
  const std::string userAgent_;
  const Dictionary* override_ = nullptr;  ///< "agents.NAME" within rawBag_
  std::vector<std::string> problems_;

  std::string version_;
  bool isEnabled_;
  bool feedbackEnabled_;
  std::optional<std::string> searchURL_, warmURL_, feedbackURL_, crowdsourcingURL_;
  std::uint64_t minimumQueryLength_;
  double timeoutIntervalForRequest_;
  double searchRenderTimeout_;
  bool sendGeoEnvironmentHeader_;
  std::set<std::string> supportedGeoLocationSources_;
  double subscriptionTTL_;
  Strings domainWhitelist_, bundleIdentifierWhitelist_;
};

}  // namespace sable

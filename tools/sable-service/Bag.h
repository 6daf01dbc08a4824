#pragma once

#include <mutex>
#include <string>

#include "Message.h"
#include "Resources.h"

namespace service {

/// The bag and the resources it names. Keys given on the command line or at run time stand over the built-in
/// ones (a null removes a key). Safe from any thread.
class Bag {
 public:
  /// `base` is the service's own address without a trailing slash: all URLs of the built-in bag begin with
  /// it.
  explicit Bag(std::string base);

  /// Merges the members of an object into the bag (RFC 7396).
  void merge(const Json& keys);
  /// Gives a resource a new content, and the bag its URL: of another version, so that devices which see a new
  /// bag fetch it.
  void setResource(const std::string& identifier, std::string content);

  /// GET /bag, with an entity tag. `version` stands over the bag's own.
  Answer answer(const Request& request, const std::optional<std::string>& version);
  /// GET /resources/...: see Resources.
  Answer resourceAnswer(const Request& request);

 private:
  void list(const std::string& identifier);

  const std::string base_;
  std::mutex mutex_;
  Resources resources_;
  Json keys_;
};

}  // namespace service

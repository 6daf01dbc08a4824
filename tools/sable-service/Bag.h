#pragma once

#include <mutex>
#include <string>

#include "Message.h"

namespace service {

/// The bag and the resources it names. Keys given on the command line or at run time stand over the built-in
/// ones (a null removes a key). Safe from any thread.
class Bag {
 public:
  /// `base` is the service's own address without a trailing slash: all URLs of the built-in bag begin with
  /// it.
  explicit Bag(const std::string& base);

  /// Merges the members of an object into the bag (RFC 7396).
  void merge(const Json& keys);
  /// Replaces the content of a resource.
  void setResource(const std::string& identifier, std::string content);

  /// GET /bag, with an entity tag. `version` stands over the bag's own.
  Answer answer(const Request& request, const std::optional<std::string>& version);
  /// GET /resources/ID, with an entity tag.
  Answer resourceAnswer(const Request& request);

 private:
  std::mutex mutex_;
  Json keys_;
  std::map<std::string, std::string> resources_;
};

}  // namespace service

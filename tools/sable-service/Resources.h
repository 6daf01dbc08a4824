#pragma once

#include <cstddef>
#include <map>
#include <optional>
#include <string>

#include "Message.h"

namespace service {

/// The files that the bag names. Each has a revision, which a new content raises; the version of one that is
/// redirected is "DATE-REVISION-ID", of another the revision. One thread at a time.
///
///   GET /resources/ID                     the file, or for hints for lookups 302 to
///   GET /resources/ID/DATE/REVISION/file  the file, while it is of that revision
///
/// 304 when If-None-Match names the version or the entity tag. With ?bytes=N zeros behind the content make it
/// N bytes long; they are never held in memory, so that N may be anything.
class Resources {
 public:
  Resources();

  void set(const std::string& identifier, std::string content);
  /// Its path, with the query item "version" where that tells it; the others' redirects do.
  std::string path(const std::string& identifier) const;
  const auto& all() const { return resources_; }

  Answer answer(const Request& request) const;

 private:
  struct Resource {
    std::string content;
    std::string date;  ///< of the revision, UTC
    size_t revision = 0;
  };

  std::map<std::string, Resource> resources_;
};

}  // namespace service

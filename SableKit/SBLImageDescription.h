#pragma once

#include <optional>
#include <string>

namespace sable {

/// Where an image is: at a URL, or under an identifier of the bag, or both.
struct SBLImageDescription {
  std::optional<std::string> url;
  std::optional<std::string> id;
};

}  // namespace sable

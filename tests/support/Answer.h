#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "SableKit/SBLReply.h"

namespace sable::test {

/// What a request ended with.
struct Answer {
  std::uint64_t queryId = 0;
  std::optional<SBLReply> reply;
  std::optional<Error> error;

  /// "" where there is none.
  std::string data() const { return reply && reply->data ? *reply->data : std::string(); }
  std::string reason() const { return error ? error->reason : std::string(); }
  bool isClean() const { return reply && !error; }
};

}  // namespace sable::test

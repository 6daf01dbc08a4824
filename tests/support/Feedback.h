#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "sabled/SableFeedback.h"

namespace sable::test {

/// A feedback of the class, its message in protobuf's JSON form, of an agent.
std::shared_ptr<SableFeedback> feedbackFromJSON(std::string_view className, const std::string& json,
                                                std::string agent = "Beacon/1",
                                                std::optional<UUID> userGuid = std::nullopt,
                                                std::int64_t queryId = 7);

}  // namespace sable::test

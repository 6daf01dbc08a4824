#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "sabled/SableFeedback.h"

namespace sable::test {

/// A feedback of the class, its message in protobuf's JSON form, as query 7 of an agent.
std::shared_ptr<SableFeedback> feedbackFromJSON(std::string_view className, const std::string& json,
                                                std::string agent = "Beacon/1",
                                                std::optional<UUID> userGuid = std::nullopt);

}  // namespace sable::test

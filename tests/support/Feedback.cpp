#include "tests/support/Feedback.h"

#include <stdexcept>

#include "SableKit/messages/MessageJSON.h"

namespace sable::test {

std::shared_ptr<SableFeedback> feedbackFromJSON(std::string_view className, const std::string& json,
                                                std::string agent, std::optional<UUID> userGuid,
                                                std::int64_t queryId) {
  const auto bytes = messageFromJSON(className, json);
  if (!bytes) throw std::invalid_argument(bytes.error().reason + " in " + json);
  auto message = FeedbackMessage::parse(className, *bytes);
  if (!message) throw std::invalid_argument(message.error().reason + " in " + json);
  return std::make_shared<SableFeedback>(std::move(*message), queryId, userGuid, std::move(agent));
}

}  // namespace sable::test

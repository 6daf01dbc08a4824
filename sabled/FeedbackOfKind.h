#pragma once

#include <utility>

#include "sabled/FeedbackKinds.h"
#include "sabled/FeedbackMessage.h"
#include "sabled/FeedbackProcessing.h"
#include "sabled/ParsedMessage.h"

namespace sable::feedback {

/// Why bytes are no message of the class.
tl::unexpected<Error> noMessage(std::string_view className);
/// Whether the text is a JSON object; if not, why it is refused.
Expected<void> checkOwnObject(std::string_view className, const std::string& text);

/// A message of a class and the kind that the class is of. The name is a constant.
template <class Kind, class M>
class FeedbackOfKind final : public FeedbackMessage {
 public:
  explicit FeedbackOfKind(std::string_view className, M message = {})
      : className_(className), message_(std::move(message)) {}

  Expected<void> assign(std::string_view bytes) override {
    if (!parseMessage(message_, bytes)) return noMessage(className_);
    if constexpr (std::is_same_v<Kind, Custom>) return checkOwnObject(className_, message_.json_feedback());
    return {};
  }

  std::string_view className() const override { return className_; }

  void write(JSONObject& object) const override {
    if constexpr (!std::is_same_v<Kind, Custom>) Kind::write(message_, object);
  }

  std::optional<Dictionary> ownObject() const override {
    if constexpr (std::is_same_v<Kind, Custom>) return Custom::own(message_);
    return std::nullopt;
  }

  unsigned type() const override { return Kind::type(message_); }
  bool requiresQueryId() const override { return Kind::requiresQueryId(message_); }

  bool hasIdentifiers() const override { return Kind::identifiers != Identifiers::kept; }

  void process(SessionProcessingHelper& helper) override {
    if constexpr (Kind::identifiers != Identifiers::kept) {
      processMembers(message_, Kind::identifiers == Identifiers::expanded, helper);
    }
  }

  std::uint64_t timestamp() const override { return message_.timestamp(); }

  std::uint64_t clientQueryId() const override {
    if constexpr (requires { message_.query_id(); }) {
      return message_.query_id();
    } else if constexpr (requires { message_.blending_duration(); }) {
      // A ranking belongs to the query of what it ranked.
      const bool ranked = message_.sections_size() > 0 && message_.sections(0).results_size() > 0;
      return ranked ? message_.sections(0).results(0).result().query_id() : 0;
    }
    return 0;
  }

  std::optional<ResultEngagement> resultEngagement() const override {
    if constexpr (std::is_same_v<Kind, ResultEngaged>) {
      const auto& result = message_.result();
      return ResultEngagement{result.top_hit() != 0, result.type(), message_.completed_query()};
    }
    return std::nullopt;
  }

  std::optional<SearchViewAppearance> searchViewAppearance() const override {
    if constexpr (std::is_same_v<Kind, SearchViewAppear>) {
      return SearchViewAppearance{message_.on_lock_screen(), message_.view_appear_event()};
    }
    return std::nullopt;
  }

  std::optional<std::uint32_t> customFeedbackType() const override {
    if constexpr (std::is_same_v<Kind, Custom>) return message_.feedback_type();
    return std::nullopt;
  }

  const M& message() const override { return message_; }

 private:
  std::string_view className_;
  M message_;
};

}  // namespace sable::feedback

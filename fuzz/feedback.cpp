#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <nlohmann/json.hpp>

#include "sabled/SableFeedback.h"
#include "sabled/SessionProcessingHelper.h"

// The first byte names the class. Whatever a client reports is refused or becomes a record that its
// session file gives back, that can be uploaded, and whose processed form can be too.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace sable;
  if (size == 0) return 0;
  static const auto classes = FeedbackMessage::classNames();
  const std::string_view bytes(reinterpret_cast<const char*>(data + 1), size - 1);
  auto message = FeedbackMessage::parseReported(classes[data[0] % classes.size()], bytes);
  if (!message) return message.error().reason.empty() ? std::abort(), 0 : 0;

  const std::uint64_t clientQueryId = (*message)->clientQueryId();
  SableFeedback record(std::move(*message), 1, std::nullopt, "Agent/1", clientQueryId);
  auto again = SableFeedback::parse(record.data());
  if (!again || compactJSON(again->dictionary()) != compactJSON(record.dictionary())) std::abort();

  SessionProcessingHelper helper;
  again->process(helper);
  if (!parseJSON(again->description(), 64u << 20)) std::abort();
  return 0;
}

#pragma once

#include <google/protobuf/message_lite.h>
#include <google/protobuf/stubs/logging.h>

#include <string_view>
#include <utility>

namespace sable {

/// Reads bytes into a message; false when they are none. What strangers send wrongly is told where it
/// is refused, so the library's own lines on standard error are kept away, from the first message on.
inline bool parseMessage(google::protobuf::MessageLite& message, std::string_view bytes) {
  [[maybe_unused]] static auto* const silenced = google::protobuf::SetLogHandler(nullptr);
  return std::in_range<int>(bytes.size()) &&
         message.ParseFromArray(bytes.data(), static_cast<int>(bytes.size()));
}

}  // namespace sable

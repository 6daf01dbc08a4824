#pragma once

#include <google/protobuf/message_lite.h>
#include <google/protobuf/stubs/logging.h>

#include <string_view>
#include <utility>

namespace sable {

/// Reads bytes into a message; false when they are none. What strangers send wrongly is told where it
/// is refused, so the library's own line on standard error is held back.
inline bool parseMessage(google::protobuf::MessageLite& message, std::string_view bytes) {
  const google::protobuf::LogSilencer silence;
  return std::in_range<int>(bytes.size()) &&
         message.ParseFromArray(bytes.data(), static_cast<int>(bytes.size()));
}

}  // namespace sable

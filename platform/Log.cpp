#include "platform/Log.h"

#include <fmt/format.h>

#include <atomic>
#include <exception>

#include "platform/Subsystem.h"

namespace sable::platform {

namespace {

std::atomic<LogSink*> installedSink = nullptr;

constinit const LogHandle platformHandle(kSubsystem, "Platform");

}  // namespace

std::string_view logLevelName(LogLevel level) {
  switch (level) {
    case LogLevel::debug:
      return "debug";
    case LogLevel::info:
      return "info";
    case LogLevel::standard:
      return "default";
    case LogLevel::error:
      return "error";
    case LogLevel::fault:
      return "fault";
  }
  return "default";
}

void installLogSink(LogSink* sink) {
  installedSink.store(sink, std::memory_order_release);
}

bool LogHandle::shows(LogLevel level) const {
  const LogSink* sink = installedSink.load(std::memory_order_acquire);
  return sink != nullptr && sink->shows(level, category_);
}

void LogHandle::write(LogLevel level, fmt::string_view format, fmt::format_args args) const {
  LogSink* sink = installedSink.load(std::memory_order_acquire);
  if (sink == nullptr || !sink->shows(level, category_)) return;
  fmt::memory_buffer message;
  try {
    fmt::vformat_to(std::back_inserter(message), format, args);
  } catch (const std::exception& failure) {
    // A line that cannot be formatted is worth less than the work it tells of.
    message.append(std::string_view(" [not formatted: "));
    message.append(std::string_view(failure.what()));
    message.push_back(']');
  }
  sink->write({level, subsystem_, category_, {message.data(), message.size()}});
}

const LogHandle& platformLog() {
  return platformHandle;
}

}  // namespace sable::platform

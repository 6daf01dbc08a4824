#pragma once

#include <string>
#include <vector>

#include "platform/Log.h"

namespace sable::platform::host {

/// Log lines for the operator: entries in the systemd journal when standard error is connected to
/// it (sd-daemon: $JOURNAL_STREAM), with the fields SUBSYSTEM and CATEGORY; else one line each on
/// standard error, in one write:
///
///     2026-11-22T20:59:24.123Z error Sable_Bag: message
///
/// Times are UTC, the default log's category is "default". What could forge a line or drive a
/// terminal (control and format characters, bytes that are no UTF-8) appears escaped.
class HostLog final : public LogSink {
 public:
  /// Shows `minimum` and what is above it, of `categories` only unless there are none.
  HostLog(LogLevel minimum, std::vector<std::string> categories);

  bool shows(LogLevel level, std::string_view category) const override;
  void write(const LogRecord& record) override;

 private:
  const LogLevel minimum_;
  const std::vector<std::string> categories_;
  const bool toJournal_;
};

}  // namespace sable::platform::host

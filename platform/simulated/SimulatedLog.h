#pragma once

#include <cstddef>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Log.h"

namespace sable::platform::simulated {

/// Records every line; the process's sink as long as it lives.
class SimulatedLog final : public LogSink {
 public:
  struct Line {
    LogLevel level;
    std::string category;  ///< empty for the default log
    std::string message;
  };

  SimulatedLog() { installLogSink(this); }
  ~SimulatedLog() override { installLogSink(nullptr); }
  SimulatedLog(const SimulatedLog&) = delete;
  SimulatedLog& operator=(const SimulatedLog&) = delete;

  bool shows(LogLevel, std::string_view) const override { return true; }
  void write(const LogRecord& record) override;

  std::vector<Line> lines() const;
  /// Lines whose message holds `substring`.
  std::size_t count(std::string_view substring) const;
  /// Lines of a level, in one category or in all.
  std::size_t count(LogLevel level) const;
  std::size_t count(LogLevel level, std::string_view category) const;
  bool contains(std::string_view substring) const { return count(substring) > 0; }
  void clear();

 private:
  mutable std::mutex mutex_;
  std::vector<Line> lines_;
};

}  // namespace sable::platform::simulated

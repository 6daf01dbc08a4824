#pragma once

#include <fmt/core.h>

#include <string>
#include <string_view>

namespace sable::platform {

/// Ordered: a sink that shows a level shows all later ones. `standard` prints as "default".
enum class LogLevel { debug, info, standard, error, fault };

std::string_view logLevelName(LogLevel level);

struct LogRecord {
  LogLevel level;
  std::string_view subsystem;
  std::string_view category;  ///< empty for the default log
  std::string_view message;
};

/// Where log lines end up. write() is called from any thread, also at the same time.
class LogSink {
 public:
  virtual ~LogSink() = default;
  virtual bool shows(LogLevel level, std::string_view category) const = 0;
  virtual void write(const LogRecord& record) = 0;
};

/// Installs the process's sink; null drops every line. The sink must outlive all logging.
void installLogSink(LogSink* sink);

/// A category to log under. Formatting costs nothing when the sink does not show the level.
class LogHandle {
 public:
  constexpr LogHandle(std::string_view subsystem, std::string_view category)
      : subsystem_(subsystem), category_(category) {}

  std::string_view category() const { return category_; }
  bool shows(LogLevel level) const;

  template <class... Args>
  void debug(fmt::format_string<Args...> format, Args&&... args) const {
    write(LogLevel::debug, format, fmt::make_format_args(args...));
  }
  template <class... Args>
  void info(fmt::format_string<Args...> format, Args&&... args) const {
    write(LogLevel::info, format, fmt::make_format_args(args...));
  }
  template <class... Args>
  void standard(fmt::format_string<Args...> format, Args&&... args) const {
    write(LogLevel::standard, format, fmt::make_format_args(args...));
  }
  template <class... Args>
  void error(fmt::format_string<Args...> format, Args&&... args) const {
    write(LogLevel::error, format, fmt::make_format_args(args...));
  }
  template <class... Args>
  void fault(fmt::format_string<Args...> format, Args&&... args) const {
    write(LogLevel::fault, format, fmt::make_format_args(args...));
  }

 private:
  void write(LogLevel level, fmt::string_view format, fmt::format_args args) const;

  std::string_view subsystem_;
  std::string_view category_;
};

/// The log of the platform layer itself: category "Platform".
const LogHandle& platformLog();

}  // namespace sable::platform

#include "platform/simulated/SimulatedLog.h"

#include <algorithm>

namespace sable::platform::simulated {

namespace {

template <class Condition>
std::size_t countLines(const std::vector<SimulatedLog::Line>& lines, Condition condition) {
  return static_cast<std::size_t>(std::count_if(lines.begin(), lines.end(), condition));
}

}  // namespace

void SimulatedLog::write(const LogRecord& record) {
  const std::lock_guard lock(mutex_);
  lines_.push_back({record.level, std::string(record.category), std::string(record.message)});
}

std::vector<SimulatedLog::Line> SimulatedLog::lines() const {
  const std::lock_guard lock(mutex_);
  return lines_;
}

std::size_t SimulatedLog::count(std::string_view substring) const {
  return countLines(lines(),
                    [&](const Line& line) { return line.message.find(substring) != std::string::npos; });
}

std::size_t SimulatedLog::count(LogLevel level) const {
  return countLines(lines(), [&](const Line& line) { return line.level == level; });
}

std::size_t SimulatedLog::count(LogLevel level, std::string_view category) const {
  return countLines(lines(),
                    [&](const Line& line) { return line.level == level && line.category == category; });
}

void SimulatedLog::clear() {
  const std::lock_guard lock(mutex_);
  lines_.clear();
}

}  // namespace sable::platform::simulated

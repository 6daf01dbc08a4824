#pragma once

#include <map>
#include <string>

#include "platform/Tally.h"

namespace sable::platform::simulated {

/// Counters in memory.
class SimulatedTally final : public Tally {
 public:
  void add(std::string_view key, std::int64_t value) override { counters_[std::string(key)] += value; }
  void set(std::string_view key, std::int64_t value) override { counters_[std::string(key)] = value; }
  std::map<std::string, std::int64_t> snapshot() const override { return counters_; }

  /// The counter's value; 0 when nothing was counted.
  std::int64_t value(const std::string& key) const {
    const auto found = counters_.find(key);
    return found == counters_.end() ? 0 : found->second;
  }

 private:
  std::map<std::string, std::int64_t> counters_;
};

}  // namespace sable::platform::simulated

#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <string_view>

namespace sable::platform {

/// Aggregate counters by name. They survive the process, also kill -9. Any thread; add() neither
/// blocks nor makes a system call once its key is known.
class Tally {
 public:
  virtual ~Tally() = default;
  virtual void add(std::string_view key, std::int64_t value) = 0;
  virtual void set(std::string_view key, std::int64_t value) = 0;
  virtual std::map<std::string, std::int64_t> snapshot() const = 0;
};

}  // namespace sable::platform

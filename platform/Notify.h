#pragma once

#include <string_view>

namespace sable::platform {

/// System-wide notification by name: other processes learn that it happened, nothing else. Any
/// thread; never blocks. Without a way to reach others it does nothing (logged once).
class Notify {
 public:
  virtual ~Notify() = default;
  virtual void post(std::string_view name) = 0;
};

}  // namespace sable::platform

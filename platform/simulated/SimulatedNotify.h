#pragma once

#include <string>
#include <vector>

#include "platform/Notify.h"

namespace sable::platform::simulated {

class SimulatedNotify final : public Notify {
 public:
  void post(std::string_view name) override { posted_.emplace_back(name); }

  /// All names posted so far, oldest first.
  const std::vector<std::string>& posted() const { return posted_; }

 private:
  std::vector<std::string> posted_;
};

}  // namespace sable::platform::simulated

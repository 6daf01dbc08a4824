#pragma once

#include <utility>
#include <vector>

#include "platform/UserActivity.h"

namespace sable::platform::simulated {

class SimulatedUserActivity final : public UserActivity {
 public:
  void donate(Interaction interaction) override { donated_.push_back(std::move(interaction)); }

  /// All interactions so far, oldest first.
  const std::vector<Interaction>& donated() const { return donated_; }

 private:
  std::vector<Interaction> donated_;
};

}  // namespace sable::platform::simulated

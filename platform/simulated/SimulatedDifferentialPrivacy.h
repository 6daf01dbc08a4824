#pragma once

#include <utility>
#include <vector>

#include "platform/DifferentialPrivacy.h"

namespace sable::platform::simulated {

class SimulatedDifferentialPrivacy final : public DifferentialPrivacy {
 public:
  void record(PrivateReport report) override { reports_.push_back(std::move(report)); }

  /// All reports so far, oldest first.
  const std::vector<PrivateReport>& reports() const { return reports_; }

 private:
  std::vector<PrivateReport> reports_;
};

}  // namespace sable::platform::simulated

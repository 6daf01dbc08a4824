#pragma once

#include <cstdint>
#include <string>

#include "platform/LocalRandomizer.h"

namespace sable::platform {

/// One randomised report for one question. It never holds the answer itself.
struct PrivateReport {
  std::string key;  ///< what was asked, the same on every device
  RandomizedAnswer answer;
};

/// Takes reports from which a collector learns how common an answer is among many devices, and of no
/// device what it answered: whoever reports has randomised the answer (randomizedAnswer) before it gets
/// here. Any thread; never blocks. Without a collector it does nothing.
class DifferentialPrivacy {
 public:
  virtual ~DifferentialPrivacy() = default;
  virtual void record(PrivateReport report) = 0;
};

}  // namespace sable::platform

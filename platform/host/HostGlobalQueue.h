#pragma once

#include "platform/host/HostReactor.h"

namespace sable::platform::host {

/// The process-wide queue of one quality of service: straight onto the pool.
class HostGlobalQueue final : public Queue, public std::enable_shared_from_this<HostGlobalQueue> {
 public:
  HostGlobalQueue(HostReactor& reactor, QualityOfService quality) : reactor_(reactor), quality_(quality) {}

  void async(Function<void()> work) override { reactor_.post(quality_, std::move(work)); }
  [[nodiscard]] Timer after(Duration delay, Function<void()> work) override {
    return reactor_.timers().add(delay, shared_from_this(), std::move(work));
  }

 private:
  HostReactor& reactor_;
  const QualityOfService quality_;
};

}  // namespace sable::platform::host

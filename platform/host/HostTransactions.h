#pragma once

#include <cstddef>
#include <memory>

#include "platform/Transaction.h"
#include "platform/host/HostRuntime.h"

namespace sable::platform::host {

/// Counts open transactions. While there are any, and for a second after the last, a delay
/// inhibitor of systemd-logind (org.freedesktop.login1.Manager.Inhibit, what "shutdown") holds a
/// shutdown back as far as logind lets it. It is taken and dropped on a background queue; once
/// logind turns out to be missing, nobody asks again and transactions are only counted.
class HostTransactions final : public Transactions {
 public:
  explicit HostTransactions(HostRuntime& runtime);
  ~HostTransactions() override;

  [[nodiscard]] std::shared_ptr<Transaction> open(std::string_view name) override;

  std::size_t openCount() const;

 private:
  class State;
  class Open;
  const std::shared_ptr<State> state_;
};

}  // namespace sable::platform::host

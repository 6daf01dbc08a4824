#pragma once

#include <cstddef>
#include <functional>
#include <map>
#include <memory>
#include <string>

#include "platform/Transaction.h"

namespace sable::platform::simulated {

/// Counts transactions by name.
class SimulatedTransactions final : public Transactions {
 public:
  [[nodiscard]] std::shared_ptr<Transaction> open(std::string_view name) override;

  /// Open now, of one name or of all.
  std::size_t openCount(std::string_view name) const;
  std::size_t openCount() const;
  /// Opened so far.
  std::size_t openedCount(std::string_view name) const;

 private:
  struct Count {
    std::size_t open = 0;
    std::size_t opened = 0;
  };
  using Counts = std::map<std::string, Count, std::less<>>;
  class Open;

  const std::shared_ptr<Counts> counts_ = std::make_shared<Counts>();  // a transaction may outlive this
};

}  // namespace sable::platform::simulated

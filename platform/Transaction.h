#pragma once

#include <memory>
#include <string_view>

namespace sable::platform {

/// Keeps the daemon from being stopped while work is in flight; ends with the object.
class Transaction {
 public:
  virtual ~Transaction() = default;
};

class Transactions {
 public:
  virtual ~Transactions() = default;
  /// Opens a transaction; `name` says what for ("bagFetch"). Any thread, never blocks.
  [[nodiscard]] virtual std::shared_ptr<Transaction> open(std::string_view name) = 0;
};

}  // namespace sable::platform

#include "platform/simulated/SimulatedTransactions.h"

#include <utility>

namespace sable::platform::simulated {

class SimulatedTransactions::Open final : public Transaction {
 public:
  Open(std::shared_ptr<Counts> counts, Count& count) : counts_(std::move(counts)), count_(count) {
    ++count_.open;
    ++count_.opened;
  }
  ~Open() override { --count_.open; }
  Open(const Open&) = delete;
  Open& operator=(const Open&) = delete;

 private:
  const std::shared_ptr<Counts> counts_;
  Count& count_;
};

std::shared_ptr<Transaction> SimulatedTransactions::open(std::string_view name) {
  return std::make_shared<Open>(counts_, (*counts_)[std::string(name)]);
}

std::size_t SimulatedTransactions::openCount(std::string_view name) const {
  const auto found = counts_->find(name);
  return found == counts_->end() ? 0 : found->second.open;
}

std::size_t SimulatedTransactions::openCount() const {
  std::size_t total = 0;
  for (const auto& [name, count] : *counts_) total += count.open;
  return total;
}

std::size_t SimulatedTransactions::openedCount(std::string_view name) const {
  const auto found = counts_->find(name);
  return found == counts_->end() ? 0 : found->second.opened;
}

}  // namespace sable::platform::simulated

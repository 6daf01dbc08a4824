#include "sabled/FeedbackLedger.h"

#include <algorithm>

#include "sabled/SableFeedback.h"

namespace sable::ledger {

void take(platform::Tally& tally, SableFeedback& feedback) {
  if (feedback.enterLedger()) count(tally, SBLLedgerEntry::taken);
}

void countFile(platform::Tally& tally, SBLLedgerEntry entry, std::int64_t records) {
  count(tally, entry, records);
  tally.add(fileCounterOf(entry), 1);
}

void settleStored(platform::Tally& tally, const SBLFeedbackLedger& before, std::int64_t stored) {
  // A kill between writing and counting leaves one record too many in the files; more than was on its
  // way have come from elsewhere, or the counters have.
  const std::int64_t waiting = std::max<std::int64_t>(before.waiting(), 0);
  const std::int64_t surplus = stored - before.stored();
  const std::int64_t written = std::clamp<std::int64_t>(surplus, 0, waiting);
  count(tally, SBLLedgerEntry::written, written);
  count(tally, SBLLedgerEntry::lostWriting, waiting - written);
  count(tally, SBLLedgerEntry::found, std::max<std::int64_t>(surplus - written, 0));
  count(tally, SBLLedgerEntry::missing, std::max<std::int64_t>(-surplus, 0));
  // Only a power cut leaves more ends than beginnings; what has ended had been taken.
  count(tally, SBLLedgerEntry::taken, std::max<std::int64_t>(-before.waiting(), 0));
}

void settleSending(platform::Tally& tally, std::int64_t sending) {
  const std::int64_t surplus = sending - SBLFeedbackLedger(tally.snapshot()).sending();
  count(tally, SBLLedgerEntry::lostSending, std::max<std::int64_t>(-surplus, 0));
  // A kill came between deleting a file and counting, or the counters were lost: what is sent had
  // been in a file.
  count(tally, SBLLedgerEntry::found, std::max<std::int64_t>(surplus, 0));
  count(tally, SBLLedgerEntry::handedOver, std::max<std::int64_t>(surplus, 0));
}

}  // namespace sable::ledger

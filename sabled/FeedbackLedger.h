#pragma once

#include <cstdint>

#include "SableKit/SBLFeedbackLedger.h"
#include "platform/Tally.h"

/// The ledger of feedback: what became of every record, in counters that outlive the process however
/// it ends (SBLFeedbackLedger.h has the stages). Each end is counted once, where it happens and
/// after it has happened; what a kill leaves between the two is set right at the next start. Any
/// thread; neither blocks nor makes a system call.
///
/// Who sends what SablePersistentStorage has handed over counts each of these records once, as unsent,
/// uploaded or refused: as many as ClientSession::getSessionFeedbacks() has, for the envelope may add
/// some. The number goes with the upload, for the process that hears of its end may be another.
namespace sable {
class SableFeedback;
}

namespace sable::ledger {

inline void count(platform::Tally& tally, SBLLedgerEntry entry, std::int64_t records = 1) {
  if (records != 0) tally.add(counterOf(entry), records);
}

/// Counts the feedback as taken, unless it was counted before on its way.
void take(platform::Tally& tally, SableFeedback& feedback);

/// Counts the records of a file that is gone, and the file.
void countFile(platform::Tally& tally, SBLLedgerEntry entry, std::int64_t records);

/// At a start: `stored` records are in files, of which the counters said `before` at the very start.
/// What was on its way then is written, as far as the files have more than was counted, or lost.
void settleStored(platform::Tally& tally, const SBLFeedbackLedger& before, std::int64_t stored);

/// At a start, before a first session is handed over or the end of an upload heard of: uploads of
/// `sending` records are still under way. What else was being sent is lost; what is sent beyond the
/// counters is found.
void settleSending(platform::Tally& tally, std::int64_t sending);

}  // namespace sable::ledger

#include "SableKit/SBLFeedbackLedger.h"

namespace sable {
namespace {

using enum SBLLedgerEntry;

struct Keys {
  SBLLedgerEntry entry;
  std::string_view records, files;
};

/// In the order of the entries.
constexpr Keys kKeys[] = {
    {taken, "com.kestrel.sabled.ledger.taken", ""},
    {bagDisabled, "com.kestrel.sabled.ledger.bagdisabled", ""},
    {noAgent, "com.kestrel.sabled.ledger.noagent", ""},
    {noFile, "com.kestrel.sabled.ledger.nofile", ""},
    {sizeLimit, "com.kestrel.sabled.ledger.sizelimit", ""},
    {unwritten, "com.kestrel.sabled.ledger.unwritten", ""},
    {lostWriting, "com.kestrel.sabled.ledger.lostwriting", ""},
    {written, "com.kestrel.sabled.ledger.written", ""},
    {found, "com.kestrel.sabled.ledger.found", ""},
    {tooOld, "com.kestrel.sabled.ledger.tooold", "com.kestrel.sabled.ledger.files.tooold"},
    {tooLarge, "com.kestrel.sabled.ledger.toolarge", "com.kestrel.sabled.ledger.files.toolarge"},
    {otherVersion, "com.kestrel.sabled.ledger.otherversion", "com.kestrel.sabled.ledger.files.otherversion"},
    {damaged, "com.kestrel.sabled.ledger.damaged", "com.kestrel.sabled.ledger.files.damaged"},
    {missing, "com.kestrel.sabled.ledger.missing", ""},
    {handedOver, "com.kestrel.sabled.ledger.handedover", ""},
    {uploaded, "com.kestrel.sabled.ledger.uploaded", ""},
    {refused, "com.kestrel.sabled.ledger.refused", ""},
    {unsent, "com.kestrel.sabled.ledger.unsent", ""},
    {lostSending, "com.kestrel.sabled.ledger.lostsending", ""},
};

constexpr bool isInOrder() {
  std::size_t expected = 0;
  for (const Keys& keys : kKeys) {
    if (static_cast<std::size_t>(keys.entry) != expected++) return false;
  }
  return expected == kSBLLedgerEntries;
}
static_assert(isInOrder());

}  // namespace

std::string_view counterOf(SBLLedgerEntry entry) {
  return kKeys[static_cast<std::size_t>(entry)].records;
}

std::string_view fileCounterOf(SBLLedgerEntry entry) {
  return kKeys[static_cast<std::size_t>(entry)].files;
}

SBLFeedbackLedger::SBLFeedbackLedger(const std::map<std::string, std::int64_t>& counters) {
  for (const Keys& keys : kKeys) {
    const auto counter = counters.find(std::string(keys.records));
    if (counter != counters.end()) records_[static_cast<std::size_t>(keys.entry)] = counter->second;
  }
}

std::int64_t SBLFeedbackLedger::waiting() const {
  const auto& entry = *this;
  return entry[taken] - entry[bagDisabled] - entry[noAgent] - entry[noFile] - entry[sizeLimit] -
         entry[unwritten] - entry[lostWriting] - entry[written];
}

std::int64_t SBLFeedbackLedger::stored() const {
  const auto& entry = *this;
  return entry[written] + entry[found] - entry[tooOld] - entry[tooLarge] - entry[otherVersion] -
         entry[damaged] - entry[missing] - entry[handedOver];
}

std::int64_t SBLFeedbackLedger::sending() const {
  const auto& entry = *this;
  return entry[handedOver] - entry[uploaded] - entry[refused] - entry[unsent] - entry[lostSending];
}

}  // namespace sable

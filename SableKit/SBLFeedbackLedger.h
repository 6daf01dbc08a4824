#pragma once

#include <array>
#include <cstdint>
#include <map>
#include <string>
#include <string_view>

namespace sable {

/// What can happen to a feedback record. Each is a counter of records (counterOf), which only grows.
/// A record goes from left to right and ends in one of the named ways or in a file:
///
///     taken ---> on its way to a file ---> written ---> in a file ---> handedOver ---> being sent
///                 bagDisabled              found -->     tooOld                        uploaded
///                 noAgent                                tooLarge                      refused
///                 noFile                                 otherVersion                  unsent
///                 sizeLimit                              damaged                       lostSending
///                 unwritten                              missing
///                 lostWriting
///
/// The three stages in between have no counter: they hold what has come in and not gone out.
enum class SBLLedgerEntry : std::size_t {
  taken,        ///< reported to a session, by a client or the daemon itself
  bagDisabled,  ///< the bag turns feedback off for its agent
  noAgent,      ///< for a shared session, which needs an agent
  noFile,       ///< no file could be made for its session
  sizeLimit,    ///< its session's file had no room for it
  unwritten,    ///< writing the file had failed, or the session had ended
  lostWriting,  ///< the daemon ended before the record was in a file; noticed at the next start
  written,      ///< is in its session's file
  found,        ///< was in a file at a start, and the counters did not know of it

  tooOld,        ///< its file was deleted at a start, for its age
  tooLarge,      ///< its file was deleted unread: it had grown past the limit
  otherVersion,  ///< its file was deleted unread: another build had written it
  damaged,       ///< its file was deleted unread, or read up to a record before it
  missing,       ///< was in a file when the daemon ended, and no longer at the next start
  handedOver,    ///< was read for sending, and its file deleted

  uploaded,     ///< the service took it (status 200)
  refused,      ///< the upload ended in any other way
  unsent,       ///< no upload began: no endpoint, or its session could not be packed
  lostSending,  ///< the daemon ended before its upload was accepted; noticed at the next start
};
inline constexpr std::size_t kSBLLedgerEntries = 19;

/// The counter's key.
std::string_view counterOf(SBLLedgerEntry entry);
/// The key of the counter of files that ended so; empty but for tooOld, tooLarge, otherVersion and
/// damaged.
std::string_view fileCounterOf(SBLLedgerEntry entry);

/// The counters at one moment, and what follows from them. While feedback comes in, a record may have
/// been counted at one stage and not yet at the next; at rest the sums are exact.
class SBLFeedbackLedger {
 public:
  explicit SBLFeedbackLedger(const std::map<std::string, std::int64_t>& counters);

  std::int64_t operator[](SBLLedgerEntry entry) const { return records_[static_cast<std::size_t>(entry)]; }
  std::int64_t waiting() const;  ///< on their way to a file
  std::int64_t stored() const;   ///< in files
  std::int64_t sending() const;  ///< handed over and not heard of again

 private:
  std::array<std::int64_t, kSBLLedgerEntries> records_{};
};

}  // namespace sable

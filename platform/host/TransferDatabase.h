#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "platform/BackgroundTransfers.h"
#include "platform/host/SQLiteStatement.h"

namespace sable::platform::host {

/// Kept in the file: never renumber.
enum class TransferState { waiting = 0, running = 1, ended = 2, reported = 3 };

/// How many of the last uploads are remembered whatever their age.
inline constexpr int kRememberedUploads = 20;

/// A row of the file.
struct TransferRow {
  std::string session;
  BackgroundTransfer transfer;
  TransferState state = TransferState::waiting;
  std::int64_t size = 0;  ///< of an upload's body
};

/// Background transfers in an SQLite file (0600). A change survives a power cut from the return of the
/// call that made it: write-ahead log, synchronized at each commit. Blocks on the disk; one thread at a
/// time. All calls return SQLite's result codes.
///
///     transfers: id | session | kind | url | method | headers | description | token | accepted | window
///                | size | state | attempts | last_attempt | pause
///                | current_url | status | response_headers | error_domain | error_code | error_reason
///
/// Headers are "Name: value" lines, times and durations nanoseconds (times since 1970), `status` is 0
/// without a response, `error_code` 0 without an error. Ids are never used twice.
class TransferDatabase {
 public:
  /// Opens the file, or makes it; new ids are greater than `lastIdentifier`.
  static int open(const std::filesystem::path& path, std::int64_t lastIdentifier, TransferDatabase& into);

  /// Begins a transaction that adds a row; commit() or rollBack() ends it.
  int add(const TransferRow& row, std::string_view token, std::int64_t& identifier);
  int commit() { return execute("COMMIT"); }
  void rollBack() { execute("ROLLBACK"); }

  int update(const BackgroundTransfer& transfer, TransferState state);
  int remove(std::int64_t identifier);
  /// Drops the session's reported rows accepted before that time, but for the last uploads.
  int forget(std::string_view session, WallTime before);

  /// Of the session, and not reported.
  int unreported(std::string_view session, std::vector<TransferRow>& rows);
  /// All, oldest first.
  int all(std::vector<TransferRow>& rows);
  int hasToken(std::string_view session, std::string_view token, WallTime since, bool& found);
  /// TransferState::reported as well for an id that has no row.
  int stateOf(std::int64_t identifier, bool& exists, TransferState& state);

  /// The rows of a file that a daemon may have open, oldest first; it goes on undisturbed.
  static Expected<std::vector<TransferRow>> read(const std::filesystem::path& path);

  explicit operator bool() const { return database_ != nullptr; }
  void close() { database_.reset(); }

 private:
  int execute(const char* sql) { return sqlite3_exec(database_.get(), sql, nullptr, nullptr, nullptr); }
  int select(const char* condition, std::string_view session, std::vector<TransferRow>& rows);
  int prepare(std::int64_t lastIdentifier);

  SQLiteDatabase database_;
};

}  // namespace sable::platform::host

#include "platform/host/TransferDatabase.h"

#include <cerrno>

namespace sable::platform::host {
namespace {

constexpr int kApplicationId = 0x5AB17AF5;
constexpr int kSchemaVersion = 1;
// Another process may be reading.
constexpr int kLockWaitMilliseconds = 5000;

constexpr const char* kSettings =
    "PRAGMA cache_size=-256;"
    "PRAGMA journal_mode=WAL;"
    "PRAGMA synchronous=FULL;";

constexpr const char* kSchema =
    "BEGIN IMMEDIATE;"
    "PRAGMA application_id=1521580789;"
    "PRAGMA user_version=1;"
    "CREATE TABLE transfers(id INTEGER PRIMARY KEY AUTOINCREMENT, session TEXT NOT NULL,"
    " kind INTEGER NOT NULL, url TEXT NOT NULL, method TEXT NOT NULL, headers TEXT NOT NULL,"
    " description TEXT NOT NULL, token TEXT NOT NULL, accepted INTEGER NOT NULL, window INTEGER NOT NULL,"
    " size INTEGER NOT NULL, state INTEGER NOT NULL DEFAULT 0, attempts INTEGER NOT NULL DEFAULT 0,"
    " last_attempt INTEGER NOT NULL DEFAULT 0, pause INTEGER NOT NULL DEFAULT 0,"
    " current_url TEXT NOT NULL, status INTEGER NOT NULL DEFAULT 0,"
    " response_headers TEXT NOT NULL DEFAULT '', error_domain TEXT NOT NULL DEFAULT '',"
    " error_code INTEGER NOT NULL DEFAULT 0, error_reason TEXT NOT NULL DEFAULT '');"
    "CREATE INDEX transfers_token ON transfers(token) WHERE token<>'';"
    "CREATE INDEX transfers_state ON transfers(state);"
    "COMMIT;";

constexpr const char* kColumns =
    "SELECT id, session, kind, url, method, headers, description, accepted, window, size, state, attempts,"
    " last_attempt, pause, current_url, status, response_headers, error_domain, error_code, error_reason"
    " FROM transfers WHERE ";

std::int64_t stored(WallTime time) {
  return time.time_since_epoch().count();
}

TransferRow rowFrom(SQLiteStatement& statement) {
  TransferRow row;
  BackgroundTransfer& transfer = row.transfer;
  HTTPBackgroundTask& task = transfer.task;
  task.identifier = statement.number(0);
  row.session = statement.bytes(1);
  task.kind = HTTPBackgroundTaskKind{static_cast<int>(statement.number(2))};
  task.originalRequest.url = statement.bytes(3);
  task.originalRequest.method = statement.bytes(4);
  task.originalRequest.headers = headersFromLines(statement.bytes(5));
  task.description = statement.bytes(6);
  transfer.accepted = WallTime(Duration(statement.number(7)));
  transfer.window = Duration(statement.number(8));
  row.size = statement.number(9);
  row.state = TransferState{static_cast<int>(statement.number(10))};
  transfer.running = row.state == TransferState::running;
  transfer.ended = row.state >= TransferState::ended;
  transfer.attempts = static_cast<int>(statement.number(11));
  transfer.lastAttempt = WallTime(Duration(statement.number(12)));
  transfer.pause = Duration(statement.number(13));
  task.currentURL = statement.bytes(14);
  if (const auto status = static_cast<int>(statement.number(15)); status != 0) {
    task.response = HTTPResponse{task.currentURL, status, headersFromLines(statement.bytes(16)), false};
  }
  if (statement.number(18) != 0) {
    transfer.error = Error{statement.bytes(17), statement.number(18), statement.bytes(19)};
  }
  return row;
}

}  // namespace

int TransferDatabase::open(const std::filesystem::path& path, std::int64_t lastIdentifier,
                           TransferDatabase& into) {
  if (const int code = createSQLiteFile(path); code != SQLITE_OK) return code;
  sqlite3* database = nullptr;
  int code = sqlite3_open_v2(path.c_str(), &database, SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX, nullptr);
  into.database_.reset(database);
  if (code == SQLITE_OK) code = into.prepare(lastIdentifier);
  if (code != SQLITE_OK) into.close();
  return code;
}

int TransferDatabase::prepare(std::int64_t lastIdentifier) {
  sqlite3_busy_timeout(database_.get(), kLockWaitMilliseconds);
  if (const int code = execute(kSettings); code != SQLITE_OK) return code;
  {
    SQLiteStatement signature(database_.get(),
                              "SELECT (SELECT application_id FROM pragma_application_id),"
                              " (SELECT user_version FROM pragma_user_version),"
                              " (SELECT count(*) FROM sqlite_master)");
    if (!signature.step()) return signature.code();
    if (signature.number(2) != 0) {
      const bool ours = signature.number(0) == kApplicationId && signature.number(1) == kSchemaVersion;
      return ours ? SQLITE_OK : SQLITE_NOTADB;
    }
  }
  if (const int code = execute(kSchema); code != SQLITE_OK) return code;
  SQLiteStatement sequence(database_.get(), "INSERT INTO sqlite_sequence(name, seq) VALUES('transfers', ?)");
  sequence.bind(lastIdentifier).step();
  return sequence.code();
}

int TransferDatabase::add(const TransferRow& row, std::string_view token, std::int64_t& identifier) {
  if (const int code = execute("BEGIN IMMEDIATE"); code != SQLITE_OK) return code;
  const HTTPBackgroundTask& task = row.transfer.task;
  const std::string headers = headerLines(task.originalRequest.headers);
  SQLiteStatement statement(
      database_.get(),
      "INSERT INTO transfers(session, kind, url, method, headers, description, token, accepted, window, size,"
      " current_url) VALUES(?,?,?,?,?,?,?,?,?,?,?)");
  statement.bind(row.session).bind(static_cast<std::int64_t>(task.kind)).bind(task.originalRequest.url);
  statement.bind(task.originalRequest.method).bind(headers).bind(task.description).bind(token);
  statement.bind(stored(row.transfer.accepted)).bind(row.transfer.window.count()).bind(row.size);
  statement.bind(task.currentURL).step();
  identifier = sqlite3_last_insert_rowid(database_.get());
  return statement.code();
}

int TransferDatabase::update(const BackgroundTransfer& transfer, TransferState state) {
  const HTTPBackgroundTask& task = transfer.task;
  const std::string headers = task.response ? headerLines(task.response->headers) : "";
  const Error error = transfer.error.value_or(Error{});
  SQLiteStatement statement(
      database_.get(),
      "UPDATE transfers SET state=?, attempts=?, last_attempt=?, pause=?, current_url=?, status=?,"
      " response_headers=?, error_domain=?, error_code=?, error_reason=? WHERE id=?");
  statement.bind(static_cast<std::int64_t>(state)).bind(transfer.attempts).bind(stored(transfer.lastAttempt));
  statement.bind(transfer.pause.count()).bind(task.currentURL);
  statement.bind(task.response ? task.response->status : 0).bind(headers).bind(error.domain);
  statement.bind(error.code).bind(error.reason).bind(task.identifier).step();
  return statement.code();
}

int TransferDatabase::remove(std::int64_t identifier) {
  SQLiteStatement statement(database_.get(), "DELETE FROM transfers WHERE id=?");
  statement.bind(identifier).step();
  return statement.code();
}

int TransferDatabase::forget(std::string_view session, WallTime before) {
  SQLiteStatement statement(
      database_.get(),
      "DELETE FROM transfers WHERE session=? AND state=3 AND accepted<?"
      " AND id NOT IN (SELECT id FROM transfers WHERE kind=0 ORDER BY id DESC LIMIT ?)");
  statement.bind(session).bind(stored(before)).bind(kRememberedUploads).step();
  return statement.code();
}

int TransferDatabase::select(const char* condition, std::string_view session,
                             std::vector<TransferRow>& rows) {
  const std::string sql = std::string(kColumns) + condition + " ORDER BY id";
  SQLiteStatement statement(database_.get(), sql.c_str());
  statement.bind(session);
  while (statement.step()) rows.push_back(rowFrom(statement));
  return statement.code();
}

int TransferDatabase::unreported(std::string_view session, std::vector<TransferRow>& rows) {
  return select("state<3 AND session=?", session, rows);
}

int TransferDatabase::all(std::vector<TransferRow>& rows) {
  return select("session<>?", "", rows);
}

int TransferDatabase::hasToken(std::string_view session, std::string_view token, WallTime since,
                               bool& found) {
  SQLiteStatement statement(database_.get(),
                            "SELECT 1 FROM transfers WHERE token=? AND token<>'' AND session=?"
                            " AND (accepted>=? OR state<3) LIMIT 1");
  found = statement.bind(token).bind(session).bind(stored(since)).step();
  return statement.code();
}

int TransferDatabase::stateOf(std::int64_t identifier, bool& exists, TransferState& state) {
  SQLiteStatement statement(database_.get(), "SELECT state FROM transfers WHERE id=?");
  exists = statement.bind(identifier).step();
  if (exists) state = TransferState{static_cast<int>(statement.number(0))};
  return statement.code();
}

Expected<std::vector<TransferRow>> TransferDatabase::read(const std::filesystem::path& path) {
  std::error_code missing;
  if (!std::filesystem::exists(path, missing)) {
    return tl::unexpected(posixError(missing ? missing.value() : ENOENT, path.native()));
  }
  TransferDatabase database;
  sqlite3* opened = nullptr;
  int code = sqlite3_open_v2(path.c_str(), &opened, SQLITE_OPEN_READONLY | SQLITE_OPEN_NOMUTEX, nullptr);
  database.database_.reset(opened);
  if (opened != nullptr) sqlite3_busy_timeout(opened, kLockWaitMilliseconds);
  std::vector<TransferRow> rows;
  if (code == SQLITE_OK) code = database.all(rows);
  if (code != SQLITE_OK) {
    return tl::unexpected(Error{"SQLiteErrorDomain", code, path.native() + ": " + sqlite3_errstr(code)});
  }
  return rows;
}

}  // namespace sable::platform::host

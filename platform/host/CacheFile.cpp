#include "platform/host/CacheFile.h"

#include <unistd.h>

#include "platform/Log.h"
#include "platform/host/SQLiteStatement.h"

namespace sable::platform::host {
namespace {

constexpr int kApplicationId = 0x5AB1CAC4;
constexpr int kSchemaVersion = 1;

// A session that has just ended may still be writing.
constexpr int kLockWaitMilliseconds = 250;

constexpr const char* kSettings =
    "PRAGMA locking_mode=EXCLUSIVE;"
    "PRAGMA cache_size=-256;"
    "PRAGMA journal_mode=WAL;"
    "PRAGMA synchronous=NORMAL;";

constexpr const char* kSchema =
    "BEGIN IMMEDIATE;"
    "PRAGMA application_id=1521601220;"
    "PRAGMA user_version=1;"
    "CREATE TABLE responses(url TEXT PRIMARY KEY, status INTEGER NOT NULL, headers TEXT NOT NULL,"
    " varied TEXT NOT NULL, requested INTEGER NOT NULL, received INTEGER NOT NULL,"
    " used INTEGER NOT NULL, size INTEGER NOT NULL, body BLOB NOT NULL);"
    "CREATE INDEX responses_used ON responses(used, size);"
    "COMMIT;";

}  // namespace

CacheFile::CacheFile(std::filesystem::path path, std::size_t capacity)
    : path_(std::move(path)), capacity_(capacity) {}

CacheFile::~CacheFile() = default;

std::size_t CacheFile::sizeOf(const StoredResponse& response) {
  return response.url.size() + headerLines(response.headers).size() + response.body->size();
}

bool CacheFile::open() {
  if (database_) return true;
  if (givenUp_) return false;
  int code = openDatabase();
  if (isSQLiteDamage(code)) {
    discard();
    code = openDatabase();
  }
  return !failed(code, "open");
}

int CacheFile::openDatabase() {
  if (const int code = createSQLiteFile(path_); code != SQLITE_OK) return code;
  sqlite3* database = nullptr;
  const int opened =
      sqlite3_open_v2(path_.c_str(), &database, SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX, nullptr);
  database_.reset(database);
  if (opened != SQLITE_OK) return opened;
  sqlite3_busy_timeout(database, kLockWaitMilliseconds);
  if (const int code = execute(kSettings); code != SQLITE_OK) return code;
  SQLiteStatement signature(database,
                            "SELECT (SELECT application_id FROM pragma_application_id),"
                            " (SELECT user_version FROM pragma_user_version),"
                            " (SELECT count(*) FROM sqlite_master)");
  if (!signature.step()) return signature.code();
  if (signature.number(2) == 0) return execute(kSchema);
  if (signature.number(0) != kApplicationId || signature.number(1) != kSchemaVersion) return SQLITE_NOTADB;
  SQLiteStatement sums(database, "SELECT coalesce(sum(size), 0), coalesce(max(used), 0) FROM responses");
  if (!sums.step()) return sums.code();
  bytes_ = sums.number(0);
  lastUse_ = sums.number(1);
  return SQLITE_OK;
}

int CacheFile::execute(const char* sql) {
  return sqlite3_exec(database_.get(), sql, nullptr, nullptr, nullptr);
}

// Damage costs the file, any other failure its use.
bool CacheFile::failed(int code, std::string_view what) {
  if (code == SQLITE_OK) return false;
  if (isSQLiteDamage(code) && !discarded_) {
    discard();
    return true;
  }
  givenUp_ = true;
  database_.reset();
  platformLog().error("response cache {}: cannot {}: {}; responses are kept in memory only", path_.native(),
                      what, sqlite3_errstr(code));
  return true;
}

void CacheFile::discard() {
  database_.reset();
  bytes_ = 0;
  if (!std::exchange(discarded_, true)) {
    platformLog().error("response cache {} is damaged or not ours: made anew", path_.native());
  }
  for (const char* suffix : {"", "-wal", "-shm", "-journal"}) ::unlink((path_.native() + suffix).c_str());
}

std::vector<std::string> CacheFile::urls() {
  std::vector<std::string> result;
  if (!open()) return result;
  SQLiteStatement statement(database_.get(), "SELECT url FROM responses");
  while (statement.step()) result.push_back(statement.bytes(0));
  failed(statement.code(), "read");
  return result;
}

std::optional<StoredResponse> CacheFile::read(const std::string& url) {
  if (!open()) return std::nullopt;
  SQLiteStatement statement(
      database_.get(),
      "SELECT status, headers, varied, requested, received, body FROM responses WHERE url=?");
  if (!statement.bind(url).step()) {
    failed(statement.code(), "read");
    return std::nullopt;
  }
  StoredResponse result;
  result.url = url;
  result.status = static_cast<int>(statement.number(0));
  result.headers = headersFromLines(statement.bytes(1));
  result.varied = headersFromLines(statement.bytes(2));
  result.requestTime = WallTime(Duration(statement.number(3)));
  result.responseTime = WallTime(Duration(statement.number(4)));
  result.body = makeData(statement.bytes(5));
  SQLiteStatement use(database_.get(), "UPDATE responses SET used=? WHERE url=?");
  use.bind(++lastUse_).bind(url).step();
  failed(use.code(), "write");
  return result;
}

std::vector<std::string> CacheFile::write(const StoredResponse& response) {
  remove(response.url);
  if (!open()) return {};
  const auto size = static_cast<std::int64_t>(sizeOf(response));
  const std::string headers = headerLines(response.headers);
  const std::string varied = headerLines(response.varied);
  SQLiteStatement statement(database_.get(), "INSERT INTO responses VALUES(?,?,?,?,?,?,?,?,?)");
  statement.bind(response.url).bind(response.status).bind(headers).bind(varied);
  statement.bind(response.requestTime.time_since_epoch().count());
  statement.bind(response.responseTime.time_since_epoch().count());
  statement.bind(++lastUse_).bind(size).bindBytes(*response.body).step();
  if (failed(statement.code(), "write")) return {};
  bytes_ += size;
  return makeRoom();
}

std::vector<std::string> CacheFile::makeRoom() {
  std::vector<std::string> dropped;
  while (bytes_ > static_cast<std::int64_t>(capacity_)) {
    std::string url;
    {
      SQLiteStatement oldest(database_.get(), "SELECT url FROM responses ORDER BY used LIMIT 1");
      if (!oldest.step()) break;
      url = oldest.bytes(0);
    }
    remove(url);
    dropped.push_back(std::move(url));
    if (!database_) break;
  }
  return dropped;
}

void CacheFile::remove(const std::string& url) {
  if (!open()) return;
  SQLiteStatement statement(database_.get(), "DELETE FROM responses WHERE url=? RETURNING size");
  if (statement.bind(url).step()) {
    bytes_ -= statement.number(0);
    statement.step();
  }
  failed(statement.code(), "write");
}

void CacheFile::close() {
  database_.reset();
}

}  // namespace sable::platform::host

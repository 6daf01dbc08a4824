#include "platform/host/CacheFile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <system_error>

#include "platform/Log.h"

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

std::string linesFrom(const HTTPHeaders& headers) {
  std::string lines;
  for (const auto& [name, value] : headers.fields()) lines += name + ": " + value + '\n';
  return lines;
}

HTTPHeaders headersFrom(std::string_view lines) {
  HTTPHeaders headers;
  while (!lines.empty()) {
    const auto line = lines.substr(0, lines.find('\n'));
    const auto colon = line.find(": ");
    if (colon != std::string_view::npos) {
      headers.add(std::string(line.substr(0, colon)), std::string(line.substr(colon + 2)));
    }
    lines.remove_prefix(std::min(lines.size(), line.size() + 1));
  }
  return headers;
}

bool isDamage(int code) {
  return code == SQLITE_CORRUPT || code == SQLITE_NOTADB || code == SQLITE_SCHEMA || code == SQLITE_ERROR;
}

// Made by hand, because SQLite would leave the permissions to the umask and follow a link.
int createPrivately(const std::filesystem::path& path) {
  std::error_code error;
  std::filesystem::create_directories(path.parent_path().parent_path(), error);
  if (::mkdir(path.parent_path().c_str(), 0700) != 0 && errno != EEXIST) return SQLITE_CANTOPEN;
  const int descriptor = ::open(path.c_str(), O_RDWR | O_CREAT | O_NOFOLLOW | O_CLOEXEC, 0600);
  if (descriptor < 0) return SQLITE_CANTOPEN;
  ::close(descriptor);
  return SQLITE_OK;
}

}  // namespace

/// A statement for one use.
class CacheFile::Statement {
 public:
  Statement(sqlite3* database, const char* sql) {
    code_ = sqlite3_prepare_v2(database, sql, -1, &statement_, nullptr);
  }
  ~Statement() { sqlite3_finalize(statement_); }
  Statement(const Statement&) = delete;
  Statement& operator=(const Statement&) = delete;

  Statement& bind(std::string_view text) {
    return note(
        sqlite3_bind_text64(statement_, ++bound_, text.data(), text.size(), SQLITE_STATIC, SQLITE_UTF8));
  }
  Statement& bind(std::int64_t number) { return note(sqlite3_bind_int64(statement_, ++bound_, number)); }
  Statement& bindBytes(std::string_view bytes) {
    return note(sqlite3_bind_blob64(statement_, ++bound_, bytes.data(), bytes.size(), SQLITE_STATIC));
  }

  bool step() {
    if (code_ == SQLITE_OK || code_ == SQLITE_ROW) code_ = sqlite3_step(statement_);
    return code_ == SQLITE_ROW;
  }
  /// SQLITE_OK unless something went wrong.
  int code() const { return code_ == SQLITE_DONE || code_ == SQLITE_ROW ? SQLITE_OK : code_; }

  std::int64_t number(int column) { return sqlite3_column_int64(statement_, column); }
  std::string bytes(int column) {
    const void* start = sqlite3_column_blob(statement_, column);
    const auto size = static_cast<std::size_t>(sqlite3_column_bytes(statement_, column));
    return start == nullptr ? std::string() : std::string(static_cast<const char*>(start), size);
  }

 private:
  Statement& note(int code) {
    if (code_ == SQLITE_OK) code_ = code;
    return *this;
  }

  sqlite3_stmt* statement_ = nullptr;
  int code_ = SQLITE_OK;
  int bound_ = 0;
};

CacheFile::CacheFile(std::filesystem::path path, std::size_t capacity)
    : path_(std::move(path)), capacity_(capacity) {}

CacheFile::~CacheFile() = default;

std::size_t CacheFile::sizeOf(const StoredResponse& response) {
  return response.url.size() + linesFrom(response.headers).size() + response.body->size();
}

bool CacheFile::open() {
  if (database_) return true;
  if (givenUp_) return false;
  int code = openDatabase();
  if (isDamage(code)) {
    discard();
    code = openDatabase();
  }
  return !failed(code, "open");
}

int CacheFile::openDatabase() {
  if (const int code = createPrivately(path_); code != SQLITE_OK) return code;
  sqlite3* database = nullptr;
  const int opened =
      sqlite3_open_v2(path_.c_str(), &database, SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX, nullptr);
  database_.reset(database);
  if (opened != SQLITE_OK) return opened;
  sqlite3_busy_timeout(database, kLockWaitMilliseconds);
  if (const int code = execute(kSettings); code != SQLITE_OK) return code;
  Statement signature(database,
                      "SELECT (SELECT application_id FROM pragma_application_id),"
                      " (SELECT user_version FROM pragma_user_version),"
                      " (SELECT count(*) FROM sqlite_master)");
  if (!signature.step()) return signature.code();
  if (signature.number(2) == 0) return execute(kSchema);
  if (signature.number(0) != kApplicationId || signature.number(1) != kSchemaVersion) return SQLITE_NOTADB;
  Statement sums(database, "SELECT coalesce(sum(size), 0), coalesce(max(used), 0) FROM responses");
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
  if (isDamage(code) && !discarded_) {
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
  Statement statement(database_.get(), "SELECT url FROM responses");
  while (statement.step()) result.push_back(statement.bytes(0));
  failed(statement.code(), "read");
  return result;
}

std::optional<StoredResponse> CacheFile::read(const std::string& url) {
  if (!open()) return std::nullopt;
  Statement statement(database_.get(),
                      "SELECT status, headers, varied, requested, received, body FROM responses WHERE url=?");
  if (!statement.bind(url).step()) {
    failed(statement.code(), "read");
    return std::nullopt;
  }
  StoredResponse result;
  result.url = url;
  result.status = static_cast<int>(statement.number(0));
  result.headers = headersFrom(statement.bytes(1));
  result.varied = headersFrom(statement.bytes(2));
  result.requestTime = WallTime(Duration(statement.number(3)));
  result.responseTime = WallTime(Duration(statement.number(4)));
  result.body = makeData(statement.bytes(5));
  Statement use(database_.get(), "UPDATE responses SET used=? WHERE url=?");
  use.bind(++lastUse_).bind(url).step();
  failed(use.code(), "write");
  return result;
}

std::vector<std::string> CacheFile::write(const StoredResponse& response) {
  remove(response.url);
  if (!open()) return {};
  const auto size = static_cast<std::int64_t>(sizeOf(response));
  const std::string headers = linesFrom(response.headers);
  const std::string varied = linesFrom(response.varied);
  Statement statement(database_.get(), "INSERT INTO responses VALUES(?,?,?,?,?,?,?,?,?)");
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
      Statement oldest(database_.get(), "SELECT url FROM responses ORDER BY used LIMIT 1");
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
  Statement statement(database_.get(), "DELETE FROM responses WHERE url=? RETURNING size");
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

#include "platform/host/TransferStore.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <charconv>
#include <optional>

#include "platform/Log.h"
#include "platform/host/TrustedPath.h"

namespace sable::platform::host {
namespace {

using Path = std::filesystem::path;

constexpr const char* kUpload = ".upload";
constexpr const char* kDownload = ".download";
constexpr const char* kPart = ".part";
constexpr const char* kKept = ".deflate";

std::string nameOf(std::int64_t identifier, const char* suffix) {
  return std::to_string(identifier) + suffix;
}

/// The identifiers in the names of a folder's files, ascending; other names are left alone.
std::vector<std::int64_t> identifiersIn(const Path& folder) {
  std::vector<std::int64_t> result;
  std::error_code error;
  for (const auto& file : std::filesystem::directory_iterator(folder, error)) {
    const std::string name = file.path().filename();
    std::int64_t identifier = 0;
    const auto [end, bad] = std::from_chars(name.data(), name.data() + name.size(), identifier);
    if (bad == std::errc() && *end == '.') result.push_back(identifier);
  }
  std::ranges::sort(result);
  result.erase(std::unique(result.begin(), result.end()), result.end());
  return result;
}

tl::unexpected<Error> failed(int number, const Path& path) {
  return tl::unexpected(posixError(number, path.native()));
}

Error sqliteError(int code) {
  return {"SQLiteErrorDomain", code, "transfers.db: " + std::string(sqlite3_errstr(code))};
}

/// 0, or an errno value.
int copy(int from, int to) {
  std::array<char, 65536> buffer{};
  for (;;) {
    const ssize_t count = ::read(from, buffer.data(), buffer.size());
    if (count < 0 && errno == EINTR) continue;
    if (count <= 0) return count < 0 ? errno : 0;
    for (ssize_t done = 0; done < count;) {
      const ssize_t written = ::write(to, buffer.data() + done, static_cast<std::size_t>(count - done));
      if (written < 0 && errno != EINTR) return errno;
      done += std::max<ssize_t>(written, 0);
    }
  }
}

}  // namespace

TransferStore::TransferStore(Path stateFolder, std::function<bool()> keepsUploads)
    : folder_(std::move(stateFolder)),
      spool_(folder_ / "transfers"),
      uploads_(folder_ / "uploads"),
      keepsUploads_(std::move(keepsUploads)) {}

Path TransferStore::databaseIn(const Path& stateFolder) {
  return stateFolder / "transfers.db";
}

Path TransferStore::bodyIn(const Path& stateFolder, std::int64_t identifier) {
  std::error_code error;
  for (Path path : {stateFolder / "uploads" / nameOf(identifier, kKept),
                    stateFolder / "transfers" / nameOf(identifier, kUpload)}) {
    if (std::filesystem::exists(path, error)) return path;
  }
  return {};
}

Path TransferStore::part(std::int64_t identifier) const {
  return spool_ / nameOf(identifier, kPart);
}

Expected<void> TransferStore::open() {
  if (database_) return {};
  if (auto opened = openFolder(); !opened) return opened;
  int code = openDatabase();
  if (isSQLiteDamage(code)) {
    discard();
    code = openDatabase();
  }
  if (code != SQLITE_OK) {
    return tl::unexpected(sqliteError(code));
  }
  if (!std::exchange(recovered_, true)) recover();
  return {};
}

Expected<void> TransferStore::openFolder() {
  if (lock_) return {};
  const auto folder = openTrustedFolder(spool_, MissingFolders::create);
  if (!folder) return tl::unexpected(folder.error());
  Descriptor lock(openat(folder->number(), ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!lock || flock(lock.number(), LOCK_EX | LOCK_NB) != 0) return failed(errno, spool_);
  lock_ = std::move(lock);
  return {};
}

int TransferStore::openDatabase() {
  std::int64_t last = 0;
  for (const Path& folder : {spool_, uploads_}) {
    const auto identifiers = identifiersIn(folder);
    if (!identifiers.empty()) last = std::max(last, identifiers.back());
  }
  return TransferDatabase::open(databaseIn(folder_), last, database_);
}

void TransferStore::discard() {
  database_.close();
  const std::string path = databaseIn(folder_).native();
  platformLog().error("{} is damaged or not ours: moved aside, what was under way is lost", path);
  ::rename(path.c_str(), (path + ".damaged").c_str());
  for (const char* suffix : {"-wal", "-shm", "-journal"}) ::unlink((path + suffix).c_str());
}

Expected<void> TransferStore::run(const std::function<int()>& operation) {
  if (auto opened = open(); !opened) return opened;
  int code = operation();
  if (isSQLiteDamage(code)) {
    discard();
    if (auto opened = open(); !opened) return opened;
    code = operation();
  }
  if (code == SQLITE_OK) return {};
  return tl::unexpected(sqliteError(code));
}

void TransferStore::recover() {
  for (const std::int64_t identifier : identifiersIn(spool_)) {
    bool exists = false;
    TransferState state{};
    if (database_.stateOf(identifier, exists, state) != SQLITE_OK) return;
    if (exists && state == TransferState::reported) tidy(identifier);
    if (exists) continue;
    platformLog().info("transfer {} is not in the database: its files are removed", identifier);
    for (const char* suffix : {kUpload, kDownload, kPart}) {
      unlinkat(lock_.number(), nameOf(identifier, suffix).c_str(), 0);
    }
  }
}

std::vector<BackgroundTransfer> TransferStore::unreported(const std::string& session) {
  const std::lock_guard lock(mutex_);
  std::vector<BackgroundTransfer> result;
  if (identifiersIn(spool_).empty()) return result;
  std::vector<TransferRow> rows;
  const auto read = run([&] {
    rows.clear();
    return database_.unreported(session, rows);
  });
  if (!read)
    platformLog().error("transfers of the last run cannot be resumed: {}", read.error().description());
  for (TransferRow& row : rows) result.push_back(std::move(row.transfer));
  return result;
}

Expected<std::int64_t> TransferStore::accept(const std::string& session, const BackgroundTransfer& transfer,
                                             std::string_view token, const Path& body) {
  const std::lock_guard lock(mutex_);
  TransferRow row{session, transfer, TransferState::waiting, 0};
  Descriptor source;
  if (transfer.task.kind == HTTPBackgroundTaskKind::upload) {
    auto opened = openTrustedFile(body, LastLink::refuse);
    if (!opened) return tl::unexpected(opened.error());
    struct stat status {};
    if (fstat(opened->number(), &status) != 0) return failed(errno, body);
    row.size = status.st_size;
    source = std::move(*opened);
  }
  std::int64_t identifier = 0;
  if (auto added = run([&] { return database_.add(row, token, identifier); }); !added) {
    if (database_) database_.rollBack();
    return tl::unexpected(added.error());
  }
  auto kept = store(identifier, transfer.task.kind, source.number());
  if (kept) {
    const int code = database_.commit();
    if (code == SQLITE_OK) return identifier;
    kept = tl::unexpected(sqliteError(code));
  }
  database_.rollBack();
  for (const char* suffix : {kUpload, kDownload}) {
    unlinkat(lock_.number(), nameOf(identifier, suffix).c_str(), 0);
  }
  return tl::unexpected(kept.error());
}

Expected<void> TransferStore::store(std::int64_t identifier, HTTPBackgroundTaskKind kind, int body) {
  const bool upload = kind == HTTPBackgroundTaskKind::upload;
  const std::string name = nameOf(identifier, upload ? kUpload : kDownload);
  const Descriptor file(openat(lock_.number(), name.c_str(),
                               O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, S_IRUSR | S_IWUSR));
  if (!file) return failed(errno, spool_ / name);
  if (const int number = upload ? copy(body, file.number()) : 0; number != 0) {
    return failed(number, spool_ / name);
  }
  if (fsync(file.number()) != 0 || fsync(lock_.number()) != 0) return failed(errno, spool_ / name);
  return {};
}

void TransferStore::note(const BackgroundTransfer& transfer) {
  const std::lock_guard lock(mutex_);
  const auto state = transfer.ended     ? TransferState::ended
                     : transfer.running ? TransferState::running
                                        : TransferState::waiting;
  if (transfer.ended && transfer.task.kind == HTTPBackgroundTaskKind::download) {
    const Descriptor file(::open(part(transfer.task.identifier).c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
    if (file) fsync(file.number());  // it is handed out from here on, after a power cut too
  }
  const auto noted = run([&] { return database_.update(transfer, state); });
  if (!noted)
    platformLog().error("transfer {} is not noted: {}", transfer.task.identifier,
                        noted.error().description());
}

void TransferStore::noteReported(const std::string& session, const BackgroundTransfer& transfer,
                                 WallTime forgetBefore) {
  const std::lock_guard lock(mutex_);
  const std::int64_t identifier = transfer.task.identifier;
  const auto noted = run([&] {
    if (transfer.task.kind == HTTPBackgroundTaskKind::download) return database_.remove(identifier);
    const int code = database_.update(transfer, TransferState::reported);
    return code == SQLITE_OK ? database_.forget(session, forgetBefore) : code;
  });
  if (!noted) {
    platformLog().error("the end of transfer {} is not noted: {}", identifier, noted.error().description());
    return;
  }
  tidy(identifier);
}

void TransferStore::tidy(std::int64_t identifier) {
  unlinkat(lock_.number(), nameOf(identifier, kPart).c_str(), 0);
  unlinkat(lock_.number(), nameOf(identifier, kDownload).c_str(), 0);
  const std::string body = nameOf(identifier, kUpload);
  const bool keeps = keepsUploads_();
  if (keeps) {
    const auto folder = openTrustedFolder(uploads_, MissingFolders::create);
    if (folder) renameat(lock_.number(), body.c_str(), folder->number(), nameOf(identifier, kKept).c_str());
  }
  unlinkat(lock_.number(), body.c_str(), 0);
  keepLast(keeps ? kRememberedUploads : 0);
}

void TransferStore::keepLast(std::size_t count) {
  auto kept = identifiersIn(uploads_);
  kept.resize(kept.size() - std::min(kept.size(), count));
  for (const std::int64_t identifier : kept) ::unlink((uploads_ / nameOf(identifier, kKept)).c_str());
}

bool TransferStore::hasAccepted(const std::string& session, std::string_view token, WallTime since) {
  const std::lock_guard lock(mutex_);
  std::error_code error;
  if (!database_ && !std::filesystem::exists(databaseIn(folder_), error)) return false;
  bool found = false;
  const auto asked = run([&] { return database_.hasToken(session, token, since, found); });
  if (!asked) platformLog().error("past uploads cannot be looked up: {}", asked.error().description());
  return found;
}

void TransferStore::rest() {
  const std::lock_guard lock(mutex_);
  database_.close();
}

Expected<Descriptor> TransferStore::openBody(std::int64_t identifier) {
  return openTrustedFile(spool_ / nameOf(identifier, kUpload), LastLink::refuse);
}

Expected<Descriptor> TransferStore::openPart(std::int64_t identifier) {
  const auto folder = openTrustedFolder(spool_, MissingFolders::fail);
  if (!folder) return tl::unexpected(folder.error());
  Descriptor file(openat(folder->number(), nameOf(identifier, kPart).c_str(),
                         O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, S_IRUSR | S_IWUSR));
  if (!file) return failed(errno, part(identifier));
  return file;
}

}  // namespace sable::platform::host

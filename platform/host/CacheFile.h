#pragma once

#include <filesystem>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/host/CacheRules.h"
#include "platform/host/SQLiteStatement.h"

namespace sable::platform::host {

/// Stored responses in an SQLite file (0600, in a folder 0700), least recently used ones dropped when
/// it is full. Blocks on the disk; lives on one queue, whichever thread runs it.
///
///     responses: url | status | headers | varied | requested | received | used | size | body
///
/// Headers are "Name: value" lines, times nanoseconds since 1970, `used` a number that grows with
/// every use, `size` the bytes of url, headers and body. The file is locked while it is open, so that
/// a second process cannot use it. A file that is damaged, or not ours, is deleted and made anew;
/// one that cannot be used at all is given up for the life of the object. Either is logged once.
class CacheFile {
 public:
  CacheFile(std::filesystem::path path, std::size_t capacity);
  ~CacheFile();
  CacheFile(const CacheFile&) = delete;
  CacheFile& operator=(const CacheFile&) = delete;

  /// Whether the file can be used; opens it when it is closed.
  bool isUsable() { return open(); }
  /// The URLs it holds.
  std::vector<std::string> urls();

  std::optional<StoredResponse> read(const std::string& url);
  /// Keeps a response in the place of another of that URL; the URLs dropped for it.
  std::vector<std::string> write(const StoredResponse& response);
  void remove(const std::string& url);

  /// Closes it; the next operation opens it again.
  void close();

  static std::size_t sizeOf(const StoredResponse& response);

 private:
  bool open();
  int openDatabase();
  int execute(const char* sql);
  bool failed(int code, std::string_view what);
  void discard();
  std::vector<std::string> makeRoom();

  const std::filesystem::path path_;
  const std::size_t capacity_;
  SQLiteDatabase database_;
  std::int64_t bytes_ = 0;
  std::int64_t lastUse_ = 0;
  bool discarded_ = false;
  bool givenUp_ = false;
};

}  // namespace sable::platform::host

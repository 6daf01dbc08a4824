#pragma once

#include <sqlite3.h>

#include <cstdint>
#include <filesystem>
#include <memory>
#include <string>
#include <string_view>

#include "platform/HTTPSession.h"

/// What the users of SQLite have in common.
namespace sable::platform::host {

struct SQLiteCloser {
  void operator()(sqlite3* database) const { sqlite3_close_v2(database); }
};
using SQLiteDatabase = std::unique_ptr<sqlite3, SQLiteCloser>;

/// Whether a result code says that the file cannot be what we wrote.
bool isSQLiteDamage(int code);

/// Makes an empty file (0600, its folder 0700) where there is none: SQLite would leave the permissions
/// to the umask and follow a link. A result code.
int createSQLiteFile(const std::filesystem::path& path);

/// Headers as a text to keep: "Name: value" lines.
std::string headerLines(const HTTPHeaders& headers);
HTTPHeaders headersFromLines(std::string_view lines);

/// A statement for one use. Values are bound in order, by reference; columns are read after step().
class SQLiteStatement {
 public:
  SQLiteStatement(sqlite3* database, const char* sql);
  ~SQLiteStatement() { sqlite3_finalize(statement_); }
  SQLiteStatement(const SQLiteStatement&) = delete;
  SQLiteStatement& operator=(const SQLiteStatement&) = delete;

  SQLiteStatement& bind(std::string_view text);
  SQLiteStatement& bind(std::int64_t number);
  SQLiteStatement& bindBytes(std::string_view bytes);

  /// Whether there is a row.
  bool step();
  /// SQLITE_OK unless something went wrong.
  int code() const { return code_ == SQLITE_DONE || code_ == SQLITE_ROW ? SQLITE_OK : code_; }

  std::int64_t number(int column) { return sqlite3_column_int64(statement_, column); }
  std::string bytes(int column);

 private:
  SQLiteStatement& note(int code);

  sqlite3_stmt* statement_ = nullptr;
  int code_ = SQLITE_OK;
  int bound_ = 0;
};

}  // namespace sable::platform::host

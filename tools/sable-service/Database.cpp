#include "Database.h"

namespace service {

namespace {

void check(bool good, sqlite3* handle) {
  if (!good) throw std::runtime_error(handle != nullptr ? sqlite3_errmsg(handle) : "out of memory");
}

}  // namespace

Database::Database(const std::filesystem::path& path, int flags) : handle_(nullptr, sqlite3_close) {
  sqlite3* handle = nullptr;
  const int status = sqlite3_open_v2(path.c_str(), &handle, flags, nullptr);
  handle_.reset(handle);
  check(status == SQLITE_OK, handle);
}

void Database::run(const char* sql) {
  check(sqlite3_exec(get(), sql, nullptr, nullptr, nullptr) == SQLITE_OK, get());
}

Statement::Statement(const Database& database, const char* sql) : statement_(nullptr, sqlite3_finalize) {
  sqlite3_stmt* statement = nullptr;
  const int status =
      sqlite3_prepare_v3(database.get(), sql, -1, SQLITE_PREPARE_PERSISTENT, &statement, nullptr);
  statement_.reset(statement);
  check(status == SQLITE_OK, database.get());
}

Statement& Statement::bind(int parameter, std::string_view text) {
  const int status = sqlite3_bind_text64(statement_.get(), parameter + 1, text.data(), text.size(),
                                         SQLITE_STATIC, SQLITE_UTF8);
  check(status == SQLITE_OK, sqlite3_db_handle(statement_.get()));
  return *this;
}

Statement& Statement::bind(int parameter, int64_t number) {
  check(sqlite3_bind_int64(statement_.get(), parameter + 1, number) == SQLITE_OK,
        sqlite3_db_handle(statement_.get()));
  return *this;
}

bool Statement::step() {
  const int status = sqlite3_step(statement_.get());
  if (status == SQLITE_ROW) return true;
  sqlite3_reset(statement_.get());
  check(status == SQLITE_DONE, sqlite3_db_handle(statement_.get()));
  return false;
}

std::string_view Statement::text(int column) const {
  const auto* bytes = reinterpret_cast<const char*>(sqlite3_column_text(statement_.get(), column));
  return bytes == nullptr
             ? std::string_view()
             : std::string_view(bytes, static_cast<size_t>(sqlite3_column_bytes(statement_.get(), column)));
}

int64_t Statement::number(int column) const {
  return sqlite3_column_int64(statement_.get(), column);
}

}  // namespace service

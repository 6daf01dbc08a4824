#pragma once

#include <sqlite3.h>

#include <cstdint>
#include <filesystem>
#include <memory>
#include <stdexcept>
#include <string>
#include <string_view>

namespace service {

/// An SQLite connection; any failure is a std::runtime_error with SQLite's own words.
class Database {
 public:
  Database(const std::filesystem::path& path, int flags);
  void run(const char* sql);
  sqlite3* get() const { return handle_.get(); }

 private:
  std::unique_ptr<sqlite3, int (*)(sqlite3*)> handle_;
};

/// A prepared statement, kept and used again. Parameters and columns count from 0; bound text must outlive
/// the steps.
class Statement {
 public:
  Statement(const Database& database, const char* sql);
  Statement& bind(int parameter, std::string_view text);
  Statement& bind(int parameter, int64_t number);
  /// True while there is a row; afterwards the statement is ready to be bound again.
  bool step();
  std::string_view text(int column) const;
  int64_t number(int column) const;

 private:
  std::unique_ptr<sqlite3_stmt, int (*)(sqlite3_stmt*)> statement_;
};

}  // namespace service

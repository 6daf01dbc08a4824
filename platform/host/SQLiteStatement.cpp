#include "platform/host/SQLiteStatement.h"

#include <fcntl.h>

#include <algorithm>

#include "platform/host/TrustedPath.h"

namespace sable::platform::host {

bool isSQLiteDamage(int code) {
  return code == SQLITE_CORRUPT || code == SQLITE_NOTADB || code == SQLITE_SCHEMA || code == SQLITE_ERROR;
}

int createSQLiteFile(const std::filesystem::path& path) {
  const auto folder = openTrustedFolder(path.parent_path(), MissingFolders::create);
  if (!folder) return SQLITE_CANTOPEN;
  const Descriptor file(
      ::openat(folder->number(), path.filename().c_str(), O_RDWR | O_CREAT | O_NOFOLLOW | O_CLOEXEC, 0600));
  return file ? SQLITE_OK : SQLITE_CANTOPEN;
}

std::string headerLines(const HTTPHeaders& headers) {
  std::string lines;
  for (const auto& [name, value] : headers.fields()) lines += name + ": " + value + '\n';
  return lines;
}

HTTPHeaders headersFromLines(std::string_view lines) {
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

SQLiteStatement::SQLiteStatement(sqlite3* database, const char* sql) {
  code_ = sqlite3_prepare_v2(database, sql, -1, &statement_, nullptr);
}

SQLiteStatement& SQLiteStatement::bind(std::string_view text) {
  const char* start = text.data() == nullptr ? "" : text.data();  // which would be NULL
  return note(sqlite3_bind_text64(statement_, ++bound_, start, text.size(), SQLITE_STATIC, SQLITE_UTF8));
}

SQLiteStatement& SQLiteStatement::bind(std::int64_t number) {
  return note(sqlite3_bind_int64(statement_, ++bound_, number));
}

SQLiteStatement& SQLiteStatement::bindBytes(std::string_view bytes) {
  return note(sqlite3_bind_blob64(statement_, ++bound_, bytes.data(), bytes.size(), SQLITE_STATIC));
}

bool SQLiteStatement::step() {
  if (code_ == SQLITE_OK || code_ == SQLITE_ROW) code_ = sqlite3_step(statement_);
  return code_ == SQLITE_ROW;
}

std::string SQLiteStatement::bytes(int column) {
  const void* start = sqlite3_column_blob(statement_, column);
  const auto size = static_cast<std::size_t>(sqlite3_column_bytes(statement_, column));
  return start == nullptr ? std::string() : std::string(static_cast<const char*>(start), size);
}

SQLiteStatement& SQLiteStatement::note(int code) {
  if (code_ == SQLITE_OK) code_ = code;
  return *this;
}

}  // namespace sable::platform::host

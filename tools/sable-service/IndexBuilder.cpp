#include <fmt/format.h>

#include <algorithm>
#include <chrono>

#include "Database.h"
#include "Index.h"

namespace service {

namespace {

constexpr int64_t kFormat = 2;

constexpr const char* kSchema = R"(
  PRAGMA journal_mode = OFF;
  PRAGMA synchronous = OFF;
  CREATE TABLE meta(format INTEGER);
  CREATE TABLE entries(id INTEGER PRIMARY KEY, reference TEXT, section TEXT, title TEXT, names TEXT, text TEXT,
                       detail TEXT, url TEXT, weight INTEGER);
  CREATE TABLE terms(corpus INTEGER, term TEXT, weight INTEGER, PRIMARY KEY(corpus, term)) WITHOUT ROWID;
  CREATE VIRTUAL TABLE dictionary_index USING fts5(names, text, content='', columnsize=0, detail=column);
  CREATE VIRTUAL TABLE packages_index USING fts5(names, text, content='', columnsize=0, detail=column);
  BEGIN;
)";

void writeEntries(const Database& database, Corpus corpus, const std::vector<Entry>& entries) {
  Statement insert(database, "INSERT INTO entries VALUES(?, ?, ?, ?, ?, ?, ?, ?, ?)");
  const auto sql = fmt::format("INSERT INTO {}_index(rowid, names, text) VALUES(?, ?, ?)", nameOf(corpus));
  Statement tokens(database, sql.c_str());
  int64_t id = kFirstId.at(static_cast<size_t>(corpus));
  for (const auto& e : entries) {
    insert.bind(0, id)
        .bind(1, e.reference)
        .bind(2, e.section)
        .bind(3, e.title)
        .bind(4, e.names)
        .bind(5, e.text);
    insert.bind(6, e.detail).bind(7, e.url).bind(8, static_cast<int64_t>(e.weight)).step();
    tokens.bind(0, id).bind(1, e.names).bind(2, e.text).step();
    ++id;
  }
}

void writeTerms(const Database& database, Corpus corpus, const Source& source) {
  std::vector<std::pair<std::string_view, uint64_t>> terms(source.terms.begin(), source.terms.end());
  std::ranges::sort(terms);
  Statement insert(database, "INSERT INTO terms VALUES(?, ?, ?)");
  for (const auto& [term, weight] : terms) {
    insert.bind(0, static_cast<int64_t>(corpus)).bind(1, term).bind(2, static_cast<int64_t>(weight)).step();
  }
}

void write(Database& database, Corpus corpus, const Source& source) {
  fmt::print(stderr, "sable-service: indexing {}: {} entries, {} terms\n", nameOf(corpus),
             source.entries.size(), source.terms.size());
  writeEntries(database, corpus, source.entries);
  writeTerms(database, corpus, source);
}

}  // namespace

void buildIndex(const std::filesystem::path& file) {
  const auto start = std::chrono::steady_clock::now();
  std::filesystem::remove(file);
  Database database(file, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE);
  database.run(kSchema);
  write(database, Corpus::dictionary, readWordNet());
  write(database, Corpus::packages, readPackages());
  Statement(database, "INSERT INTO meta VALUES(?)").bind(0, kFormat).step();
  database.run("CREATE UNIQUE INDEX entries_reference ON entries(reference)");
  database.run("COMMIT");
  const std::chrono::duration<double> spent = std::chrono::steady_clock::now() - start;
  fmt::print(stderr, "sable-service: index built in {:.1f} s\n", spent.count());
}

bool isIndex(const std::filesystem::path& file) {
  try {
    const Database database(file, SQLITE_OPEN_READONLY);
    Statement format(database, "SELECT format FROM meta");
    return format.step() && format.number(0) == kFormat;
  } catch (const std::runtime_error&) {
    return false;
  }
}

}  // namespace service

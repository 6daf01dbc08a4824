#include "Index.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <sys/file.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <numeric>
#include <set>
#include <thread>

#include "Database.h"
#include "Message.h"

namespace service {

namespace {

constexpr size_t kMostHits = 60;
/// Whoever has typed a whole term most likely means it, even where a longer one is more common.
constexpr uint64_t kWholeTermFactor = 10;

size_t numberOf(Corpus corpus) {
  return static_cast<size_t>(corpus);
}

/// Held while one process builds, so that the others wait for it rather than build as well.
class FolderLock {
 public:
  explicit FolderLock(const std::filesystem::path& folder)
      : file_(::open((folder / "lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600)) {
    if (file_ < 0 || ::flock(file_, LOCK_EX) != 0) {
      throw std::runtime_error(
          fmt::format("{}: {}", folder.string(), std::generic_category().message(errno)));
    }
  }
  ~FolderLock() { ::close(file_); }
  FolderLock(const FolderLock&) = delete;
  FolderLock& operator=(const FolderLock&) = delete;

 private:
  const int file_;
};

/// The words as an FTS5 expression that asks for each of them; "" when there is none.
std::string expression(std::string_view column, const std::string& words) {
  std::string terms;
  std::string token;
  for (const char c : words + " ") {
    const bool isPart =
        std::isalnum(static_cast<unsigned char>(c)) != 0 || static_cast<unsigned char>(c) >= 0x80;
    if (isPart)
      token += c;
    else if (!token.empty())
      terms += fmt::format("{}\"{}\"", terms.empty() ? "" : " AND ", std::exchange(token, ""));
  }
  if (terms.empty()) return "";
  return column.empty() ? terms : fmt::format("{{{}}} : ({})", column, terms);
}

/// The entry's own spelling of that name, "" when it has no such name.
std::string spelling(const Entry& entry, const std::string& name) {
  const auto at = (", " + lowercase(entry.names) + ", ").find(", " + name + ", ");
  return at == std::string::npos ? "" : entry.names.substr(at, name.size());
}

constexpr const char* kColumns = "reference, section, title, names, text, detail, url, weight";

Entry readEntry(const Statement& row) {
  return {std::string(row.text(0)), std::string(row.text(1)),
          std::string(row.text(2)), std::string(row.text(3)),
          std::string(row.text(4)), std::string(row.text(5)),
          std::string(row.text(6)), static_cast<uint64_t>(row.number(7))};
}

/// Row ids follow the weight, so the first rows are the best and the rest need not be looked at.
Statement matching(const Database& database, Corpus corpus) {
  const auto sql = fmt::format(
      "SELECT {0} FROM {1}_index JOIN entries ON entries.id = {1}_index.rowid WHERE {1}_index MATCH ? "
      "ORDER BY {1}_index.rowid LIMIT ?",
      "reference, section, title, entries.names, entries.text, detail, url, weight", nameOf(corpus));
  return {database, sql.c_str()};
}

}  // namespace

const char* nameOf(Corpus corpus) {
  return corpus == Corpus::dictionary ? "dictionary" : "packages";
}

/// One thread's view of the file.
struct Index::Reader {
  explicit Reader(const std::filesystem::path& path)
      : database(path, SQLITE_OPEN_READONLY | SQLITE_OPEN_NOMUTEX),
        matches{matching(database, Corpus::dictionary), matching(database, Corpus::packages)},
        byReference(database, fmt::format("SELECT {} FROM entries WHERE reference = ?", kColumns).c_str()),
        byWeight(database,
                 fmt::format("SELECT {} FROM entries WHERE id >= ? ORDER BY id LIMIT ?", kColumns).c_str()) {
    database.run("PRAGMA mmap_size = 268435456");
  }

  Database database;
  std::array<Statement, 2> matches;
  Statement byReference;
  Statement byWeight;
};

/// A reader for the length of one call; waits while all are taken.
class Index::Lease {
 public:
  explicit Lease(const Index& index) : index_(index) {
    std::unique_lock lock(index_.mutex_);
    index_.returned_.wait(lock, [this] { return !index_.idle_.empty(); });
    reader_ = std::move(index_.idle_.back());
    index_.idle_.pop_back();
  }
  ~Lease() {
    {
      const std::lock_guard lock(index_.mutex_);
      index_.idle_.push_back(std::move(reader_));
    }
    index_.returned_.notify_one();
  }
  Lease(const Lease&) = delete;
  Lease& operator=(const Lease&) = delete;
  Reader* operator->() const { return reader_.get(); }

 private:
  const Index& index_;
  std::unique_ptr<Reader> reader_;
};

Index::Index(const std::filesystem::path& folder) : path_(folder / "index.db") {
  std::error_code error;
  std::filesystem::create_directories(folder, error);
  {
    const FolderLock lock(folder);
    if (!isIndex(path_)) {
      const auto temporary = folder / "index.db.new";
      buildIndex(temporary);
      std::filesystem::rename(temporary, path_);
    }
  }
  const Database database(path_, SQLITE_OPEN_READONLY);
  Statement rows(database, "SELECT corpus, term, weight FROM terms ORDER BY corpus, term");
  while (rows.step()) {
    auto& terms = terms_.at(static_cast<size_t>(rows.number(0)));
    terms.texts.emplace_back(rows.text(1));
    terms.weights.push_back(static_cast<uint64_t>(rows.number(2)) + 1);
  }
  const unsigned readers = std::max(2U, std::thread::hardware_concurrency());
  while (idle_.size() < readers) idle_.push_back(std::make_unique<Reader>(path_));
  for (const auto corpus : kCorpora) {
    for (const auto& e : best(corpus, 1)) greatest_.at(numberOf(corpus)) = e.weight;
  }
}

Index::~Index() = default;

std::optional<Completion> Index::complete(Corpus corpus, const std::string& typed) const {
  if (typed.empty()) return std::nullopt;
  if (auto term = completeTerm(corpus, typed)) return term;
  return completeLastWord(corpus, typed);
}

std::pair<size_t, size_t> Index::range(const Terms& terms, const std::string& beginning) const {
  const auto cut = [&](const std::string& term) {
    return std::string_view(term).substr(0, beginning.size());
  };
  const auto first = std::ranges::lower_bound(terms.texts, beginning, {}, cut);
  const auto last = std::ranges::upper_bound(terms.texts, beginning, {}, cut);
  return {first - terms.texts.begin(), last - terms.texts.begin()};
}

std::optional<Completion> Index::completeTerm(Corpus corpus, const std::string& typed) const {
  const auto& terms = terms_.at(numberOf(corpus));
  const auto [first, last] = range(terms, typed);
  if (first == last) return std::nullopt;
  const auto begin = terms.weights.begin() + static_cast<ptrdiff_t>(first);
  const auto end = terms.weights.begin() + static_cast<ptrdiff_t>(last);
  uint64_t total = std::accumulate(begin, end, uint64_t{0});
  auto greatest = std::max_element(begin, end);
  uint64_t weight = *greatest;
  if (terms.texts[first] == typed) {
    const uint64_t whole = *begin * kWholeTermFactor;
    total += whole - *begin;
    if (whole >= weight) {
      greatest = begin;
      weight = whole;
    }
  }
  const auto& text = terms.texts[static_cast<size_t>(greatest - terms.weights.begin())];
  return Completion{text, static_cast<double>(weight) / static_cast<double>(total)};
}

std::optional<Completion> Index::completeLastWord(Corpus corpus, const std::string& typed) const {
  const auto space = typed.find_last_of(' ');
  const std::string head = space == typed.npos ? "" : typed.substr(0, space + 1);
  const std::string last = typed.substr(head.size());
  if (head.empty() || last.empty()) {
    return finds(corpus, typed) ? std::optional(Completion{typed, 1}) : std::nullopt;
  }
  const auto& terms = terms_.at(numberOf(corpus));
  const auto [first, end] = range(terms, last);
  std::vector<size_t> candidates(end - first);
  std::iota(candidates.begin(), candidates.end(), first);
  constexpr size_t kTries = 8;
  const size_t tries = std::min(kTries, candidates.size());
  std::ranges::partial_sort(candidates, candidates.begin() + static_cast<ptrdiff_t>(tries),
                            std::ranges::greater(), [&](size_t i) { return terms.weights[i]; });
  const auto begin = terms.weights.begin();
  const double total = static_cast<double>(std::accumulate(begin + static_cast<ptrdiff_t>(first),
                                                           begin + static_cast<ptrdiff_t>(end), uint64_t{0}));
  candidates.resize(tries);
  for (const size_t i : candidates) {
    const std::string text = head + terms.texts[i];
    if (finds(corpus, text)) return Completion{text, static_cast<double>(terms.weights[i]) / total};
  }
  return finds(corpus, typed) ? std::optional(Completion{typed, 1}) : std::nullopt;
}

std::vector<Hit> Index::find(Corpus corpus, const std::string& words) const {
  std::vector<Hit> hits;
  const std::string inNames = expression("names", words);
  const std::string anywhere = expression("", words);
  if (inNames.empty()) return hits;
  const Lease reader(*this);
  auto& statement = reader->matches.at(numberOf(corpus));
  std::set<std::string> seen;
  const auto collect = [&](const std::string& match, bool named) {
    statement.bind(0, match).bind(1, static_cast<int64_t>(kMostHits));
    while (statement.step()) {
      Entry found = readEntry(statement);
      if (!seen.insert(found.reference).second) continue;
      const std::string exact = spelling(found, words);
      if (!exact.empty()) found.title = exact;
      hits.push_back({std::move(found), named, !exact.empty()});
    }
  };
  collect(inNames, true);
  std::stable_partition(hits.begin(), hits.end(), [](const Hit& hit) { return hit.exact; });
  if (hits.size() < kMostHits) collect(anywhere, false);
  hits.resize(std::min(hits.size(), kMostHits));
  return hits;
}

bool Index::finds(Corpus corpus, const std::string& words) const {
  const std::string anywhere = expression("", words);
  if (anywhere.empty()) return false;
  const Lease reader(*this);
  auto& statement = reader->matches.at(numberOf(corpus));
  statement.bind(0, anywhere).bind(1, int64_t{1});
  bool found = false;
  while (statement.step()) found = true;
  return found;
}

std::vector<Hit> Index::lookUp(const std::string& name) const {
  auto hits = find(Corpus::dictionary, name);
  std::erase_if(hits, [](const Hit& hit) { return !hit.exact; });
  return hits;
}

std::optional<Entry> Index::entry(const std::string& reference) const {
  const Lease reader(*this);
  reader->byReference.bind(0, reference);
  std::optional<Entry> found;
  while (reader->byReference.step()) found = readEntry(reader->byReference);
  return found;
}

std::vector<Entry> Index::best(Corpus corpus, int64_t count) const {
  const Lease reader(*this);
  std::vector<Entry> entries;
  reader->byWeight.bind(0, kFirstId.at(numberOf(corpus))).bind(1, count);
  while (reader->byWeight.step()) entries.push_back(readEntry(reader->byWeight));
  return entries;
}

uint64_t Index::greatestWeight(Corpus corpus) const {
  return greatest_.at(numberOf(corpus));
}

}  // namespace service

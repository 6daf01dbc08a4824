#pragma once

#include <array>
#include <condition_variable>
#include <filesystem>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "Sources.h"

namespace service {

enum class Corpus { dictionary, packages };
inline constexpr std::array kCorpora = {Corpus::dictionary, Corpus::packages};

/// The id of a part's first entry; ids follow by falling weight.
inline constexpr std::array<int64_t, 2> kFirstId = {1, 1'000'000};

const char* nameOf(Corpus corpus);

struct Completion {
  std::string text;
  /// The share of this completion in the weight of all completions of what was typed: 0 to 1.
  double score = 0;
};

/// An entry found, with what makes it rank. Where one of its names is the text looked for, that is its title.
struct Hit {
  Entry entry;
  bool inNames = false;
  bool exact = false;
};

/// The searchable data: an SQLite file with a full-text index, built once and read by any number of threads.
///
///   index.db   meta(format)
///              entries(id, reference, section, title, names, text, detail, url, weight), ids by falling
///              weight from kFirstId dictionary_index, packages_index: FTS5 over names and text, the row id
///              being the entry's id terms(corpus, term, weight)
class Index {
 public:
  /// Opens the index in the folder; builds it first when there is none of this format, in a temporary file
  /// that is then renamed, with progress on stderr. Of several processes one builds and the others wait.
  /// Throws std::runtime_error when the folder cannot be used.
  explicit Index(const std::filesystem::path& folder);
  ~Index();
  Index(const Index&) = delete;
  Index& operator=(const Index&) = delete;

  /// The likeliest completion of the typed text, lower-case: a term that begins with it, or the text with its
  /// last word completed so that something is found. None when nothing would be found.
  std::optional<Completion> complete(Corpus corpus, const std::string& typed) const;
  /// Entries that contain every word, those named exactly so first, then those with the words in their names,
  /// then by weight; at most 60.
  std::vector<Hit> find(Corpus corpus, const std::string& words) const;
  /// Entries of one name exactly.
  std::vector<Hit> lookUp(const std::string& name) const;
  std::optional<Entry> entry(const std::string& reference) const;
  /// The entries of greatest weight.
  std::vector<Entry> best(Corpus corpus, int64_t count) const;
  /// The greatest weight in that part of the data.
  uint64_t greatestWeight(Corpus corpus) const;

 private:
  struct Reader;
  class Lease;
  /// Terms in order, so that those with a common beginning are neighbours.
  struct Terms {
    std::vector<std::string> texts;
    std::vector<uint64_t> weights;
  };

  std::optional<Completion> completeTerm(Corpus corpus, const std::string& typed) const;
  std::optional<Completion> completeLastWord(Corpus corpus, const std::string& typed) const;
  /// Whether any entry contains every word.
  bool finds(Corpus corpus, const std::string& words) const;
  std::pair<size_t, size_t> range(const Terms& terms, const std::string& beginning) const;

  std::filesystem::path path_;
  std::array<Terms, 2> terms_;
  std::array<uint64_t, 2> greatest_{};
  mutable std::mutex mutex_;
  mutable std::condition_variable returned_;
  mutable std::vector<std::unique_ptr<Reader>> idle_;
};

/// Reads the sources and writes the index to a file. Throws std::runtime_error.
void buildIndex(const std::filesystem::path& file);

/// True when the file is an index of the present format.
bool isIndex(const std::filesystem::path& file);

}  // namespace service

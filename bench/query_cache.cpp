// A lookup in a full query cache, and its tree against the two ordered maps that one would take
// otherwise, on the same keys: in each of the comparisons the rival is the floor.
#include <absl/container/btree_map.h>
#include <fmt/core.h>
#include <malloc.h>

#include <algorithm>
#include <cstdlib>
#include <filesystem>
#include <map>
#include <memory>
#include <random>
#include <set>
#include <string>
#include <vector>

#include "bench/support/Bench.h"
#include "platform/HTTPSession.h"
#include "platform/Log.h"
#include "platform/host/HostPlatform.h"
#include "sabled/Assembly.h"
#include "sabled/CachedResultSet.h"
#include "sabled/CritbitTree.h"
#include "sabled/QueryCache.h"
#include "sabled/SBLNetworkRequestFactory.h"

namespace {

using namespace sable::bench;

constexpr std::size_t kKeys = 2000;
constexpr std::size_t kPrefixBytes = 3;
constexpr int kRounds = 200;

using Value = std::shared_ptr<const int>;

/// Completed queries as people have them: a few words of a few syllables.
std::vector<std::string> queries() {
  constexpr const char* kSyllables[] = {"we", "ar", "th", "er", "in", "so", "na", "lo", "mi", "pe"};
  std::mt19937 random(1);
  std::set<std::string> keys;
  while (keys.size() < kKeys) {
    std::string key;
    for (std::size_t syllable = 0, count = 2 + random() % 12; syllable < count; ++syllable) {
      if (syllable > 2 && random() % 4 == 0) key += ' ';
      key += kSyllables[random() % std::size(kSyllables)];
    }
    keys.insert(key);
  }
  std::vector<std::string> shuffled(keys.begin(), keys.end());
  std::shuffle(shuffled.begin(), shuffled.end(), random);
  return shuffled;
}

/// The tree under the names of the maps.
struct Tree {
  sable::CritbitTree<const int> tree;

  void insert(const std::string& key, const Value& value) { tree.setObject(value, key); }
  Value find(const std::string& key) const { return tree.objectForKey(key); }
  template <class Visit>
  void findAll(const std::string& prefix, Visit visit) const {
    tree.keysMatchingPrefix(prefix, [&](const char*, const Value& value) { visit(value); });
  }
};

template <class Map>
struct Rival {
  Map map;

  void insert(const std::string& key, const Value& value) { map.emplace(key, value); }
  Value find(const std::string& key) const { return map.lower_bound(key)->second; }
  template <class Visit>
  void findAll(const std::string& prefix, Visit visit) const {
    for (auto at = map.lower_bound(prefix); at != map.end() && at->first.starts_with(prefix); ++at) {
      visit(at->second);
    }
  }
};

/// One structure and what was measured of it, in nanoseconds a call.
template <class Structure>
class Candidate {
 public:
  Candidate(const std::vector<std::string>& keys, const Value& value) {
    const auto before = ::mallinfo2().uordblks;
    for (const std::string& key : keys) structure_.insert(key, value);
    bytesAnEntry = static_cast<double>(::mallinfo2().uordblks - before) / static_cast<double>(keys.size());
  }

  void lookUp(const std::vector<std::string>& keys) {
    timed(exact, keys, [&](const std::string& key) { found_ += structure_.find(key) != nullptr; });
  }
  void enumerate(const std::vector<std::string>& prefixes) {
    timed(prefix, prefixes, [&](const std::string& key) {
      structure_.findAll(key, [&](const Value& value) { found_ += *value == 1; });
    });
  }
  std::size_t found() const { return found_; }

  std::vector<double> exact, prefix;
  double bytesAnEntry = 0;

 private:
  template <class Call>
  void timed(std::vector<double>& times, const std::vector<std::string>& texts, Call call) {
    Microseconds whole;
    measure(1, whole, [&] {
      for (const std::string& text : texts) call(text);
    });
    times.push_back(whole.front() * 1e3 / static_cast<double>(texts.size()));
  }

  Structure structure_;
  std::size_t found_ = 0;
};

void compareTrees(const std::vector<std::string>& keys, const std::vector<std::string>& prefixes, int argc,
                  char** argv) {
  const auto value = std::make_shared<const int>(1);
  Candidate<Tree> tree(keys, value);
  Candidate<Rival<std::map<std::string, Value>>> map(keys, value);
  Candidate<Rival<absl::btree_map<std::string, Value>>> btree(keys, value);
  const auto round = [&](auto& candidate) {
    candidate.lookUp(keys);
    candidate.enumerate(prefixes);
  };
  for (int i = 0; i < kRounds; ++i) {
    round(tree);
    round(map);
    round(btree);
  }
  if (tree.found() != map.found() || tree.found() != btree.found()) fail("the structures disagree");
  report({"critbit_exact_vs_map", "ns", median(tree.exact), median(map.exact), 1.0}, argc, argv);
  report({"critbit_exact_vs_btree", "ns", median(tree.exact), median(btree.exact), 1.0}, argc, argv);
  report({"critbit_prefix_vs_map", "ns", median(tree.prefix), median(map.prefix), 1.0}, argc, argv);
  report({"critbit_prefix_vs_btree", "ns", median(tree.prefix), median(btree.prefix), 1.0}, argc, argv);
  report({"critbit_memory_vs_map", "bytes", tree.bytesAnEntry, map.bytesAnEntry, std::nullopt}, argc, argv);
}

/// Shows what the daemon shows unless told otherwise, to nobody.
class UnreadLog : public sable::platform::LogSink {
 public:
  bool shows(sable::platform::LogLevel level, std::string_view) const override {
    return level >= sable::platform::LogLevel::standard;
  }
  void write(const sable::platform::LogRecord&) override {}
};

void measureLookups(const std::vector<std::string>& keys, const std::vector<std::string>& prefixes, int argc,
                    char** argv) {
  sable::platform::host::HostPlatform device;
  sable::Assembly assembly(device);
  sable::QueryCache cache(assembly);
  sable::platform::HTTPRequest sent;
  sent.headers.set(sable::kUIScaleHeader, "2.0");
  const auto data = sable::makeData(std::string("[]"));
  for (const std::string& key : keys) {
    const double score = static_cast<double>(key.size() % 7) / 10;
    cache.set(std::make_shared<const sable::CachedResultSet>(
        key.substr(0, 1), sent, sable::SearchResponse::ResultSet{key, score, 3600, "OK"},
        assembly.runtime.uuid(), data, assembly.runtime.now()));
  }
  if (cache.count() != kKeys) fail("the cache does not hold what it was given");

  Microseconds times;
  sable::SBLSearchRequest request;
  request.scale = 2;
  for (int i = 0; i < kRounds / 10; ++i) {
    for (const std::string& prefix : prefixes) {
      request.queryString = prefix;
      measure(1, times, [&] {
        if (cache.getRequest(request) == nullptr) fail("a prefix of a query without an answer");
      });
    }
  }
  report({"query_cache_lookup", "us", median(times), std::nullopt, 2.0}, argc, argv);
}

/// The host's platform wants folders; these go with the program.
class Folders {
 public:
  Folders() {
    char folder[] = "/tmp/sabled-bench-XXXXXX";
    if (::mkdtemp(folder) == nullptr) fail("mkdtemp");
    root_ = folder;
    for (const char* name : {"SABLED_RUNTIME_DIR", "SABLED_CACHES_DIR", "SABLED_STATE_DIR",
                             "SABLED_CONFIG_DIR", "SABLED_PROFILE"})
      ::setenv(name, (root_ / name).c_str(), 1);
  }
  ~Folders() {
    std::error_code ignored;
    std::filesystem::remove_all(root_, ignored);
  }
  Folders(const Folders&) = delete;
  Folders& operator=(const Folders&) = delete;

 private:
  std::filesystem::path root_;
};

}  // namespace

int main(int argc, char** argv) {
  UnreadLog log;
  sable::platform::installLogSink(&log);
  const Folders folders;
  const std::vector<std::string> keys = queries();
  std::vector<std::string> prefixes;
  for (const std::string& key : keys) prefixes.push_back(key.substr(0, kPrefixBytes));
  compareTrees(keys, prefixes, argc, argv);
  measureLookups(keys, prefixes, argc, argv);
  sable::platform::installLogSink(nullptr);
}

#pragma once

#include <cstdint>
#include <string>
#include <unordered_map>
#include <vector>

namespace service {

/// What the service knows, once read from its source: something with names, a text about it and a measured
/// weight.
struct Entry {
  /// Unique and the same in every build: "n00001740" (part of speech and offset in WordNet) or
  /// "package-NAME".
  std::string reference;
  /// "noun", "verb", "adjective", "adverb" or "package".
  std::string section;
  std::string title;
  /// All names of a meaning, separated by ", "; for a package its name.
  std::string names;
  std::string text;
  /// What more there is to say: the package's archive section and version.
  std::string detail;
  /// Its page, "" when it has none.
  std::string url;
  uint64_t weight = 0;
};

/// Entries by falling weight, and the terms that a typed text may be completed to, with their weights.
struct Source {
  std::vector<Entry> entries;
  std::unordered_map<std::string, uint64_t> terms;
};

/// The words and meanings of WordNet as Debian's wordnet-base installs it; empty when it is not installed. A
/// weight is how often WordNet's own texts use the word in that meaning.
Source readWordNet(const std::string& folder = "/usr/share/wordnet");

/// Every package that apt knows, or where apt knows none every installed one, with its short description. A
/// weight is the number of packages that depend on it. Terms are the names, and the words of the
/// descriptions.
Source readPackages();

}  // namespace service

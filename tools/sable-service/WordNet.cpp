#include <fmt/format.h>

#include <algorithm>
#include <charconv>
#include <fstream>
#include <sstream>

#include "Message.h"
#include "Sources.h"

namespace service {

namespace {

struct PartOfSpeech {
  const char* file;
  const char* name;
};

constexpr PartOfSpeech kParts[] = {
    {"data.noun", "noun"}, {"data.verb", "verb"}, {"data.adj", "adjective"}, {"data.adv", "adverb"}};

using Counts = std::unordered_map<std::string, uint64_t>;

/// cntlist.rev: "lemma%type:file:id:head:headid sense count" a line; the head is left out of the key.
Counts readCounts(const std::string& path) {
  Counts counts;
  std::ifstream file(path);
  std::string key;
  std::string sense;
  uint64_t count = 0;
  while (file >> key >> sense >> count) {
    size_t end = key.find('%');
    for (int colons = 0; colons < 3 && end != key.npos; ++colons) end = key.find(':', end + 1);
    counts[key.substr(0, end)] += count;
  }
  return counts;
}

int typeNumber(char type) {
  static constexpr std::string_view kTypes = "nvars";
  return static_cast<int>(kTypes.find(type)) + 1;
}

unsigned fromHex(const std::string& text) {
  unsigned value = 0;
  std::from_chars(text.data(), text.data() + text.size(), value, 16);
  return value;
}

/// "take_a_breath" as people write it; an adjective's "(p)" marks its position in a sentence and is no part
/// of it.
std::string spoken(std::string word) {
  word.resize(std::min(word.size(), word.find('(')));
  std::ranges::replace(word, '_', ' ');
  return word;
}

/// data.*: "offset file type words(hex) [word id(hex)]... pointers... | gloss".
void readMeaning(const std::string& line, const char* section, const Counts& counts, Source& source) {
  std::istringstream fields(line);
  std::string offset;
  std::string file;
  std::string type;
  std::string words;
  if (!(fields >> offset >> file >> type >> words)) return;
  Entry entry;
  entry.reference = type + offset;
  entry.section = section;
  for (unsigned left = fromHex(words); left > 0; --left) {
    std::string word;
    std::string id;
    if (!(fields >> word >> id)) return;
    const auto key = fmt::format("{}%{}:{}:{:02}", lowercase(word.substr(0, word.find('('))),
                                 typeNumber(type[0]), file, fromHex(id));
    const auto count = counts.find(key);
    const uint64_t weight = count == counts.end() ? 0 : count->second;
    word = spoken(std::move(word));
    source.terms[lowercase(word)] += weight;
    entry.weight = std::max(entry.weight, weight);
    entry.names += (entry.names.empty() ? "" : ", ") + word;
    if (entry.title.empty()) entry.title = std::move(word);
  }
  if (const auto bar = line.find(" | "); bar != line.npos) entry.text = line.substr(bar + 3);
  entry.text.erase(entry.text.find_last_not_of(' ') + 1);
  source.entries.push_back(std::move(entry));
}

}  // namespace

Source readWordNet(const std::string& folder) {
  Source source;
  const Counts counts = readCounts(folder + "/cntlist.rev");
  for (const auto& part : kParts) {
    std::ifstream file(fmt::format("{}/{}", folder, part.file));
    for (std::string line; std::getline(file, line);) {
      const bool licence = line.starts_with("  ");
      if (!licence) readMeaning(line, part.name, counts, source);
    }
  }
  std::ranges::stable_sort(source.entries, std::ranges::greater(), &Entry::weight);
  return source;
}

}  // namespace service

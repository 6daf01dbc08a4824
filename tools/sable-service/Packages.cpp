#include <fmt/format.h>

#include <algorithm>
#include <array>
#include <cctype>
#include <cstdio>
#include <memory>
#include <unordered_set>

#include "Message.h"
#include "Sources.h"

namespace service {

namespace {

std::string outputOf(const char* command) {
  const std::unique_ptr<FILE, int (*)(FILE*)> pipe(::popen(command, "re"), ::pclose);
  std::string text;
  std::array<char, 65536> buffer{};
  while (pipe) {
    const size_t count = std::fread(buffer.data(), 1, buffer.size(), pipe.get());
    if (count == 0) break;
    text.append(buffer.data(), count);
  }
  return text;
}

/// Control fields of all packages (deb822), or of the installed ones in the same form.
std::string readControl() {
  std::string text = outputOf("apt-cache dumpavail 2>/dev/null");
  if (!text.empty()) return text;
  return outputOf(
      "dpkg-query -W -f='Package: ${Package}\\nVersion: ${Version}\\nSection: ${Section}\\n"
      "Homepage: ${Homepage}\\nDepends: ${Depends}\\nDescription: ${binary:Summary}\\n\\n' 2>/dev/null");
}

using Dependents = std::unordered_map<std::string_view, uint64_t>;

/// "a (>= 1), b | c" names a, b and c.
void countDependencies(std::string_view list, Dependents& dependents) {
  while (!list.empty()) {
    const auto item = list.substr(0, list.find_first_of(",|"));
    list.remove_prefix(std::min(list.size(), item.size() + 1));
    const auto begin = std::min(item.size(), item.find_first_not_of(' '));
    const auto name = item.substr(begin, item.find_first_of(" (:", begin) - begin);
    if (!name.empty()) ++dependents[name];
  }
}

/// The value when the line is that field.
std::string_view valueOf(std::string_view line, std::string_view field) {
  if (!line.starts_with(field) || line.substr(field.size(), 2) != ": ") return {};
  return line.substr(field.size() + 2);
}

void readField(std::string_view line, Entry& entry, Dependents& dependents) {
  if (const auto v = valueOf(line, "Package"); !v.empty())
    entry.title = v;
  else if (const auto version = valueOf(line, "Version"); !version.empty())
    entry.detail += fmt::format(" {}", version);
  else if (const auto archive = valueOf(line, "Section"); !archive.empty())
    entry.detail += fmt::format(" {}", archive);
  else if (const auto page = valueOf(line, "Homepage"); !page.empty())
    entry.url = page;
  else if (const auto text = valueOf(line, "Description"); !text.empty())
    entry.text = text;
  else if (const auto list = valueOf(line, "Depends"); !list.empty())
    countDependencies(list, dependents);
}

/// Words of three letters and more; what has digits in it is no word that someone completes.
void countWords(std::string_view text, Source& source) {
  std::unordered_set<std::string> words;
  const auto isLetter = [](char c) { return std::isalpha(static_cast<unsigned char>(c)) != 0; };
  const auto isPart = [](char c) {
    return std::isalnum(static_cast<unsigned char>(c)) != 0 || static_cast<unsigned char>(c) >= 0x80;
  };
  for (const auto* at = text.begin(); at != text.end();) {
    at = std::find_if(at, text.end(), isPart);
    const auto* const end = std::find_if_not(at, text.end(), isPart);
    if (end - at > 2 && std::all_of(at, end, isLetter)) words.insert(lowercase({at, end}));
    at = end;
  }
  for (const auto& word : words) ++source.terms[word];
}

}  // namespace

Source readPackages() {
  Source source;
  Dependents dependents;
  const std::string control = readControl();
  std::unordered_set<std::string> known;
  Entry entry;
  for (std::string_view rest = control; !rest.empty();) {
    const auto line = rest.substr(0, rest.find('\n'));
    rest.remove_prefix(std::min(rest.size(), line.size() + 1));
    if (!line.empty()) {
      readField(line, entry, dependents);
      continue;
    }
    if (!entry.title.empty() && known.insert(entry.title).second) source.entries.push_back(std::move(entry));
    entry = {};
  }
  for (auto& package : source.entries) {
    package.reference = "package-" + package.title;
    package.section = "package";
    package.names = package.title;
    if (!package.detail.empty()) package.detail.erase(0, 1);
    package.weight = dependents[package.title];
    countWords(package.text, source);
    source.terms[package.title] += package.weight;
  }
  std::ranges::stable_sort(source.entries, std::ranges::greater(), &Entry::weight);
  return source;
}

}  // namespace service

#include "platform/host/TOMLFile.h"

#include <fmt/core.h>
#include <toml++/toml.h>

#include <algorithm>
#include <cerrno>
#include <nlohmann/json.hpp>
#include <sstream>

#include "platform/Log.h"
#include "platform/host/TrustedPath.h"

namespace sable::platform::host {

namespace {

constexpr std::size_t kMaximumBytes = 1u << 20;
constexpr std::size_t kMaximumFiles = 256;

WallTime wallTime(const toml::date& date, const toml::time& time, int offsetMinutes) {
  using namespace std::chrono;
  const sys_days day = year{date.year} / month{date.month} / std::chrono::day{date.day};
  return day + hours(time.hour) + minutes(time.minute - offsetMinutes) + seconds(time.second) +
         nanoseconds(time.nanosecond);
}

std::optional<WallTime> wallTime(const toml::node& node) {
  if (const auto* moment = node.as_date_time()) {
    const toml::date_time& value = moment->get();
    return wallTime(value.date, value.time, value.offset ? value.offset->minutes : 0);
  }
  if (const auto* day = node.as_date()) return wallTime(day->get(), {}, 0);
  return std::nullopt;
}

toml::date_time tomlDate(WallTime time) {
  using namespace std::chrono;
  const auto day = floor<days>(time);
  const year_month_day date(day);
  const hh_mm_ss clock(time - day);
  return {toml::date(static_cast<int>(date.year()), static_cast<unsigned>(date.month()),
                     static_cast<unsigned>(date.day())),
          toml::time(clock.hours().count(), clock.minutes().count(), clock.seconds().count(),
                     clock.subseconds().count()),
          toml::time_offset{}};
}

Dictionary dictionary(const toml::node& node) {
  if (const auto* table = node.as_table()) {
    Dictionary object = Dictionary::object();
    for (const auto& [key, value] : *table) object[std::string(key.str())] = dictionary(value);
    return object;
  }
  if (const auto* array = node.as_array()) {
    Dictionary list = Dictionary::array();
    for (const auto& element : *array) list.push_back(dictionary(element));
    return list;
  }
  if (const auto* text = node.as_string()) return text->get();
  if (const auto* number = node.as_integer()) return number->get();
  if (const auto* number = node.as_floating_point()) return number->get();
  if (const auto* flag = node.as_boolean()) return flag->get();
  if (const auto time = wallTime(node)) return secondsSince1970(*time);
  return {};
}

toml::array tomlArray(const Dictionary& list);

toml::table tomlTable(const Dictionary& object);

bool isTOMLInteger(const Dictionary& value) {
  if (value.is_number_unsigned()) return std::in_range<std::int64_t>(value.get<std::uint64_t>());
  return value.is_number_integer();
}

/// Hands the TOML counterpart of `value` to `use`, or nothing for null.
template <class Use>
void withNode(const Dictionary& value, Use use) {
  if (value.is_object()) {
    use(tomlTable(value));
  } else if (value.is_array()) {
    use(tomlArray(value));
  } else if (value.is_string()) {
    use(value.get<std::string>());
  } else if (value.is_boolean()) {
    use(value.get<bool>());
  } else if (isTOMLInteger(value)) {
    use(value.get<std::int64_t>());
  } else if (value.is_number()) {
    use(value.get<double>());
  }
}

toml::array tomlArray(const Dictionary& list) {
  toml::array array;
  for (const Dictionary& element : list) {
    withNode(element, [&](auto&& node) { array.push_back(std::forward<decltype(node)>(node)); });
  }
  return array;
}

toml::table tomlTable(const Dictionary& object) {
  toml::table table;
  for (const auto& [key, value] : object.items()) {
    withNode(value,
             [&, &name = key](auto&& node) { table.insert(name, std::forward<decltype(node)>(node)); });
  }
  return table;
}

}  // namespace

Expected<TOMLContent> parseTOML(std::string_view text) {
  try {
    const toml::table table = toml::parse(text);
    TOMLContent content;
    for (const auto& [key, node] : table) {
      const toml::source_position at = key.source().begin;
      content.emplace(key.str(), TOMLValue{std::make_shared<const Dictionary>(dictionary(node)),
                                           wallTime(node), at.line, at.column});
    }
    return content;
  } catch (const toml::parse_error& fault) {
    const toml::source_position at = fault.source().begin;
    return tl::unexpected(Error{std::string(kTOMLErrorDomain), at.line,
                                fmt::format("{}:{}: {}", at.line, at.column, fault.description())});
  }
}

std::string formatTOML(const TOMLContent& content) {
  toml::table table;
  for (const auto& [key, entry] : content) {
    if (entry.date) {
      table.insert(key, tomlDate(*entry.date));
    } else {
      withNode(*entry.value,
               [&, &name = key](auto&& node) { table.insert(name, std::forward<decltype(node)>(node)); });
    }
  }
  std::ostringstream text;
  text << table << '\n';
  return text.str();
}

Expected<std::string> readTOMLText(const std::filesystem::path& path, bool* exists) {
  if (exists != nullptr) *exists = false;
  const auto file = openTrustedFile(path, LastLink::follow);
  if (!file && file.error().code == ENOENT) return {};
  if (exists != nullptr) *exists = true;
  if (!file) return tl::unexpected(file.error());
  return readWhole(*file, path, kMaximumBytes);
}

std::vector<std::filesystem::path> tomlFilesIn(const std::filesystem::path& folder) {
  std::vector<std::filesystem::path> found;
  std::error_code error;
  for (std::filesystem::directory_iterator entry(folder, error), end; !error && entry != end;
       entry.increment(error)) {
    if (entry->path().extension() == ".toml") found.push_back(entry->path());
  }
  if (error && error != std::errc::no_such_file_or_directory) {
    platformLog().error("{}: {}", folder.native(), error.message());
  }
  std::ranges::sort(found);
  if (found.size() > kMaximumFiles) {
    platformLog().error("{}: more than {} files, the last are left out", folder.native(), kMaximumFiles);
    found.resize(kMaximumFiles);
  }
  return found;
}

void TOMLFile::report(std::string_view problem) const {
  platformLog().error("{}{}", problem, content_.empty() ? "" : "; its last good content stays");
}

bool TOMLFile::reload() {
  auto text = readTOMLText(path_);
  if (!text) {
    if (!std::exchange(damaged_, true)) {
      report(text.error().reason);
    }
    return false;
  }
  if (*text == text_) return false;
  text_ = *std::move(text);
  auto content = parseTOML(text_);
  damaged_ = !content.has_value();
  if (damaged_) {
    report(fmt::format("{}:{}", path_.native(), content.error().reason));
    return false;
  }
  content_ = *std::move(content);
  return true;
}

}  // namespace sable::platform::host

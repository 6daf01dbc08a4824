#include "platform/OpenMetrics.h"

#include <fmt/format.h>

#include <iterator>

namespace sable::platform {

namespace {

std::string escaped(const std::string& value) {
  std::string text;
  for (const char c : value) {
    if (c == '\\' || c == '"') text += '\\';
    text += c == '\n' ? std::string("\\n") : std::string(1, c);
  }
  return text;
}

}  // namespace

std::string openMetricsText(const std::map<std::string, std::int64_t>& snapshot) {
  std::string text =
      "# TYPE sabled_tally gauge\n"
      "# HELP sabled_tally Aggregate counters of the search daemon.\n";
  for (const auto& [key, value] : snapshot) {
    fmt::format_to(std::back_inserter(text), "sabled_tally{{key=\"{}\"}} {}\n", escaped(key), value);
  }
  return text + "# EOF\n";
}

}  // namespace sable::platform

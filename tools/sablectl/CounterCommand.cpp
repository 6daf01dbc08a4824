#include <fmt/format.h>

#include <nlohmann/json.hpp>

#include "tools/sablectl/Commands.h"
#include "tools/sablectl/Text.h"

namespace sable::sablectl {
namespace {

/// A label's value (OpenMetrics 1.0, "Text format": backslash, quote and line feed are escaped).
std::string labelValue(std::string_view text) {
  std::string value;
  for (const char c : text) {
    if (c == '\\' || c == '"') value += '\\';
    if (c == '\n') {
      value += "\\n";
    } else {
      value += c;
    }
  }
  return value;
}

/// One family with the key as its label: keys keep their spelling, and none can collide. Its type
/// is "unknown", for the file does not say which values only grow.
void printOpenMetrics(const Output& output, const Counters& counters) {
  output.line("# HELP sabled_tally What sabled counts, by key.\n# TYPE sabled_tally unknown");
  for (const auto& [key, value] : counters)
    output.line(fmt::format("sabled_tally{{key=\"{}\"}} {}", labelValue(key), value));
  output.line("# EOF");
}

}  // namespace

ExitCode runCounters(const Context& context, bool openMetrics) {
  const auto counters = readCounters(context);
  if (!counters) return counters.error();
  if (openMetrics) {
    printOpenMetrics(context.output, *counters);
  } else if (context.output.json) {
    Dictionary object = Dictionary::object();
    for (const auto& [key, value] : *counters) object[key] = value;
    context.output.document(object);
  } else {
    std::vector<std::vector<std::string>> rows;
    for (const auto& [key, value] : *counters) rows.push_back({printable(key), fmt::format("{:>12}", value)});
    for (const std::string& line : aligned(rows)) context.output.line(line);
    if (rows.empty()) context.output.line("nothing counted yet");
  }
  return kExitSuccess;
}

}  // namespace sable::sablectl

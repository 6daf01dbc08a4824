#include "tools/sablectl/ExplanationOutput.h"

#include <fmt/format.h>

#include <nlohmann/json.hpp>

#include "tools/sablectl/Section.h"

namespace sable::sablectl {
namespace {

std::string outcomeLine(const Dictionary& explanation) {
  const std::string outcome = textOf(explanation, "outcome");
  if (outcome == "network") return "It would ask the service.";
  if (outcome == "cache") return "It would be answered from the cache.";
  if (outcome == "error") return "It would be answered with an error: there is no bag.";
  return "It would be answered with nothing.";
}

void addGates(const Output& output, std::vector<std::string>& lines, const Dictionary& gates) {
  Section section(output, lines, "Gates");
  for (const Dictionary& gate : gates) {
    section.row({textOf(gate, "gate"), textOf(gate, "found"), textOf(gate, "wanted"),
                 member(gate, "passes") == true ? "passes" : "stops here"});
  }
}

std::string expiry(const Dictionary& seconds) {
  return seconds.is_number() ? fmt::format("{:.0f} s", seconds.get<double>()) : "never";
}

void addCache(const Output& output, std::vector<std::string>& lines, const Dictionary& cache) {
  Section section(output, lines, "Cache: " + textOf(cache, "use"));
  const Dictionary candidates = member(cache, "candidates");
  if (!candidates.empty()) section.row({"QUERY", "TYPED", "SCORE", "SCALE", "EXPIRES", ""});
  for (const Dictionary& candidate : candidates) {
    section.row({textOf(candidate, "query"), textOf(candidate, "input"), textOf(candidate, "score"),
                 textOf(candidate, "scale"), expiry(member(candidate, "expires_in")),
                 textOf(candidate, "outcome")});
  }
}

std::string remark(const Dictionary& step) {
  const std::string effect = textOf(step, "effect");
  if (effect == "set") return {};
  const std::string other = textOf(step, "other_value") + " of " + textOf(step, "other_step");
  return effect == "kept" ? "gives way to " + other : "replaces " + other;
}

void addSteps(const Output& output, std::vector<std::string>& lines, const Dictionary& request,
              std::string_view heading, std::string_view place) {
  Section section(output, lines, heading);
  for (const Dictionary& step : member(request, "steps")) {
    if (textOf(step, "place") != place) continue;
    section.row({textOf(step, "name"), textOf(step, "value"), textOf(step, "step"), remark(step)});
  }
}

void addRequest(const Output& output, std::vector<std::string>& lines, const Dictionary& request) {
  {
    Section section(output, lines, "Request");
    const bool proxied = member(request, "through_proxy") == true;
    section.row({textOf(request, "method") + " " + textOf(request, "url")});
    section.row({textOf(request, "timeout") + " s at most, " +
                 (proxied ? "through the privacy proxy" : "not through a proxy")});
  }
  addSteps(output, lines, request, "Query items, in the order in which they are added", "query item");
  addSteps(output, lines, request, "Headers", "header");
  Section section(output, lines, "Steps that have nothing to add");
  for (const Dictionary& step : member(request, "silent_steps")) section.row({plainText(step)});
}

}  // namespace

std::vector<std::string> explanationLines(const Output& output, const Dictionary& explanation) {
  std::vector<std::string> lines{outcomeLine(explanation)};
  addGates(output, lines, member(explanation, "gates"));
  const Dictionary cache = member(explanation, "cache");
  if (textOf(cache, "use") != "not asked") addCache(output, lines, cache);
  const Dictionary request = member(explanation, "request");
  if (request.is_object()) addRequest(output, lines, request);
  return lines;
}

}  // namespace sable::sablectl

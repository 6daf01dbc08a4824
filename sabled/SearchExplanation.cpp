#include "sabled/SearchExplanation.h"

#include <fmt/format.h>

#include <nlohmann/json.hpp>
#include <string>

#include "platform/Dictionary.h"
#include "sabled/CachedResultSet.h"

namespace sable {
namespace {

const char* text(SearchExplanation::Outcome outcome) {
  switch (outcome) {
    case SearchExplanation::Outcome::nothing:
      return "nothing";
    case SearchExplanation::Outcome::error:
      return "error";
    case SearchExplanation::Outcome::cache:
      return "cache";
    case SearchExplanation::Outcome::network:
      return "network";
  }
  return "";
}

const char* text(SearchExplanation::CacheUse use) {
  switch (use) {
    case SearchExplanation::CacheUse::notAsked:
      return "not asked";
    case SearchExplanation::CacheUse::off:
      return "off";
    case SearchExplanation::CacheUse::noCandidate:
      return "no candidate answers";
    case SearchExplanation::CacheUse::forcedItems:
      return "not used: the client forces query items";
    case SearchExplanation::CacheUse::hit:
      return "answers";
  }
  return "";
}

const char* text(RequestTrace::Effect effect) {
  switch (effect) {
    case RequestTrace::Effect::set:
      return "set";
    case RequestTrace::Effect::replaced:
      return "replaced";
    case RequestTrace::Effect::kept:
      return "kept";
  }
  return "";
}

Dictionary gatesDocument(const std::vector<SearchExplanation::Gate>& gates) {
  Dictionary rows = Dictionary::array();
  for (const auto& gate : gates) {
    rows.push_back(
        {{"gate", gate.name}, {"found", gate.found}, {"wanted", gate.wanted}, {"passes", gate.passes}});
  }
  return rows;
}

/// The number that reads as the float does, not as the double that stands for it.
double asItReads(float number) {
  return std::stod(fmt::format("{}", number));
}

Dictionary candidatesDocument(const QueryCacheDecision& decision) {
  Dictionary rows = Dictionary::array();
  for (const auto& [candidate, outcome] : decision.rows) {
    Dictionary expires = nullptr;
    if (candidate->expireTime) {
      expires = platform::toSeconds(*candidate->expireTime - decision.question.now);
    }
    rows.push_back({{"query", candidate->query},
                    {"input", candidate->input},
                    {"score", asItReads(candidate->completionScore)},
                    {"scale", asItReads(candidate->uiScale)},
                    {"expires_in", std::move(expires)},
                    {"outcome", std::string(queryCacheOutcomeText(outcome))}});
  }
  return rows;
}

Dictionary stepsDocument(const RequestTrace& trace) {
  Dictionary rows = Dictionary::array();
  for (const RequestTrace::Entry& entry : trace.entries()) {
    Dictionary row{{"step", entry.step},
                   {"place", entry.place == RequestTrace::Place::header ? "header" : "query item"},
                   {"name", entry.name},
                   {"value", entry.value},
                   {"effect", text(entry.effect)}};
    if (entry.effect != RequestTrace::Effect::set) {
      row["other_step"] = entry.otherStep;
      row["other_value"] = entry.otherValue;
    }
    rows.push_back(std::move(row));
  }
  return rows;
}

Dictionary requestDocument(const SearchExplanation& explanation) {
  if (!explanation.request) return nullptr;
  return {{"method", explanation.request->method},     {"url", explanation.request->url},
          {"timeout", explanation.request->timeout},   {"through_proxy", explanation.throughProxy},
          {"steps", stepsDocument(explanation.trace)}, {"silent_steps", explanation.trace.silentSteps()}};
}

}  // namespace

bool SearchExplanation::gate(std::string_view name, std::string found, std::string wanted, bool passes) {
  gates.push_back({std::string(name), std::move(found), std::move(wanted), passes});
  return passes;
}

std::string SearchExplanation::json() const {
  return compactJSON({{"outcome", text(outcome)},
                      {"gates", gatesDocument(gates)},
                      {"cache", {{"use", text(cacheUse)}, {"candidates", candidatesDocument(cache)}}},
                      {"request", requestDocument(*this)}});
}

}  // namespace sable

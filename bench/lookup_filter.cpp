// The filtering of a lookup's results, against the least it could be: the same texts made lower case and
// searched byte by byte.
#include <fmt/core.h>

#include <algorithm>
#include <cctype>
#include <nlohmann/json.hpp>
#include <string>

#include "SableKit/SBLRequest.h"
#include "bench/support/Bench.h"
#include "platform/Log.h"
#include "platform/simulated/SimulatedPlatform.h"
#include "sabled/Lookup.h"

namespace {

using namespace sable::bench;
using sable::Dictionary;

constexpr int kResults = 1000;
constexpr int kRounds = 50;

constexpr const char* kContext =
    "The new museum in New York City opens its doors to the public on Thursday after ten years of work. Its "
    "architect, who was born in Genoa, calls the house beside the river a machine for light; visitors from "
    "all "
    "over the country have booked their tickets for the first weeks, and the cafés of the quarter expect "
    "long "
    "queues. An exhibition of Japanese prints is shown first.";

Dictionary keyword(std::string word, double weight) {
  return {{"word", std::move(word)}, {"weight", weight}};
}

/// A third fails by its keywords, a third by its subject, a third fits.
Dictionary result(int number) {
  static constexpr const char* kSubjects[] = {"New York City museum", "museum of light by the river",
                                              "Thursday public exhibition"};
  const std::string own = "word" + std::to_string(number);
  return {
      {"id", number},
      {"title", "result " + std::to_string(number)},
      {"lookup_instructions",
       {{"keywords", {keyword("Museum", 1), keyword("York", 0.5), keyword("light", 0.5), keyword(own, 3)}},
        {"min_keywords_score", number % 3 == 0 ? 3 : 1.5},
        {"completion", "new york"},
        {"min_subject_score", number % 3 == 1 ? 0.5 : 0.01},
        {"subject", kSubjects[number % 3]}}}};
}

Dictionary response() {
  Dictionary results = Dictionary::array();
  for (int number = 0; number < kResults; ++number) results.push_back(result(number));
  return Dictionary::array({Dictionary{{"query", "museum"}, {"results", std::move(results)}}});
}

std::string lowered(std::string text) {
  std::ranges::transform(text, text.begin(), [](unsigned char c) { return std::tolower(c); });
  return text;
}

/// How many texts of the instructions are in the context, with the letters of ASCII alone.
int searchAll(const Dictionary& response) {
  const std::string context = lowered(kContext);
  int found = 0;
  const auto look = [&](const Dictionary& text) {
    found += context.find(lowered(text.get<std::string>())) != std::string::npos;
  };
  for (const Dictionary& result : response[0]["results"]) {
    const Dictionary& instructions = result["lookup_instructions"];
    for (const Dictionary& each : instructions["keywords"]) look(each["word"]);
    look(instructions["completion"]);
    look(instructions["subject"]);
  }
  return found;
}

/// Shows what the daemon shows unless told otherwise, to nobody.
class UnreadLog : public sable::platform::LogSink {
 public:
  bool shows(sable::platform::LogLevel level, std::string_view) const override {
    return level >= sable::platform::LogLevel::standard;
  }
  void write(const sable::platform::LogRecord&) override {}
};

}  // namespace

int main(int argc, char** argv) {
  UnreadLog log;
  sable::platform::installLogSink(&log);
  sable::platform::simulated::SimulatedPlatform device;
  sable::SBLLookupRequest request;
  request.queryContext = kContext;
  const Dictionary whole = response();
  Microseconds filtering, searching;
  for (int round = 0; round < kRounds; ++round) {
    Dictionary filtered = whole;
    measure(1, filtering, [&] { sable::Lookup::filterLookupResultsWithRequest(request, filtered, device); });
    if (filtered[0]["results"].size() != kResults / 3)
      fail("another number of results than a third was kept");
    measure(1, searching, [&] {
      if (searchAll(whole) != 4 * kResults) fail("other texts than four a result were found");
    });
  }
  const double floor = median(searching) / 1e3;
  report({"lookup_filter_1000", "ms", median(filtering) / 1e3, std::nullopt, 10.0}, argc, argv);
  report({"lookup_filter_vs_ascii", "ms", median(filtering) / 1e3, floor, std::nullopt}, argc, argv);
  sable::platform::installLogSink(nullptr);
}

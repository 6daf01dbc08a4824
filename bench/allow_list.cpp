// The signature of 500 installed applications under an allow-list of 20,000, from the list's bytes to the
// text of the header, against the unavoidable part of it: parsing the same bytes, outer and inner.
#include <simdjson.h>

#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "bench/support/Bench.h"
#include "platform/ApplicationRegistry.h"
#include "sabled/AppWhitelist.h"

namespace {

using namespace sable::bench;

constexpr int kListed = 20000;
constexpr int kInstalled = 500;
constexpr int kRounds = 300;
constexpr double kBound = 5000;  // us

std::string identifier(int number) {
  return "org.example.vendor" + std::to_string(number % 977) + ".Application" + std::to_string(number);
}

std::string whitelist() {
  nlohmann::json apps = nlohmann::json::object();
  for (int i = 0; i < kListed; ++i) apps[identifier(i)] = {{{"encoding_id", i}}};
  const nlohmann::json inner{{"version", "0a1b"}, {"apps", std::move(apps)}};
  return nlohmann::json{{"apps", inner.dump()}, {"compression", "RLE"}, {"encoding", "bitmap"}}.dump();
}

/// Four fifths of what is installed are on the list.
class Registry final : public sable::platform::ApplicationRegistry {
 public:
  Registry() {
    for (int i = 0; i < kInstalled; ++i)
      applications_.push_back({identifier(i * kListed * 5 / kInstalled / 4), "1"});
  }
  std::vector<sable::platform::InstalledApplication> installedApplications() override {
    return applications_;
  }

 private:
  std::vector<sable::platform::InstalledApplication> applications_;
};

void sign(const std::string& list, Registry& registry) {
  if (!sable::processWhitelist(list, registry)) fail("no signature");
}

void parse(const std::string& list) {
  simdjson::dom::parser outer, inner;
  std::string_view text;
  simdjson::dom::object object;
  if (outer.parse(list)["apps"].get(text) != simdjson::SUCCESS ||
      inner.parse(text.data(), text.size()).get(object) != simdjson::SUCCESS) {
    fail("the list does not parse");
  }
}

void parseIntoTree(const std::string& list) {
  const auto outer = nlohmann::json::parse(list);
  if (nlohmann::json::parse(outer["apps"].get_ref<const std::string&>())["apps"].size() != kListed) {
    fail("the list does not parse");
  }
}

}  // namespace

int main(int argc, char** argv) {
  const std::string list = whitelist();
  Registry registry;
  Microseconds signatures, parses, trees;
  for (int i = 0; i < kRounds; ++i) {
    measure(1, signatures, [&] { sign(list, registry); });
    measure(1, parses, [&] { parse(list); });
    if (i % 10 == 0) measure(1, trees, [&] { parseIntoTree(list); });
  }
  report({"allow_list_signature", "us", median(signatures), std::nullopt, kBound}, argc, argv);
  report({"allow_list_signature_vs_parse", "us", median(signatures), median(parses), 2.0}, argc, argv);
  report({"allow_list_signature_vs_tree", "us", median(signatures), median(trees), 1.0}, argc, argv);
}

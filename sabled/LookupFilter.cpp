#include <map>
#include <nlohmann/json.hpp>
#include <optional>
#include <set>

#include "SableKit/SBLRequest.h"
#include "platform/LocaleInfo.h"
#include "platform/Platform.h"
#include "platform/WordTokenizer.h"
#include "sabled/Lookup.h"
#include "sabled/SableLogging.h"

// Which results of a lookup fit the text that was looked up.
namespace sable {
namespace {

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategoryLookUp);
}

/// A number of the instructions. Scores are 32-bit floats on both sides of every comparison: a bound
/// of 0.7 is met by a weight of 0.7.
float floatMember(const Dictionary& object, std::string_view key) {
  return static_cast<float>(numberMember(object, key).value_or(0));
}

/// The text around a selection, prepared for being asked about by many results.
class Context {
 public:
  Context(std::string_view text, platform::Platform& device)
      : device_(device),
        tokenizer_(device.wordTokenizer()),
        locale_(device.localeInfo().localeIdentifier()),
        text_(text),
        folded_(tokenizer_.folded(text, locale_)) {}

  bool contains(std::string_view part) const {
    return tokenizer_.contains(folded_, tokenizer_.folded(part, locale_));
  }

  float keywordScore(const Dictionary& instructions) const {
    const auto keywords = instructions.find("keywords");
    if (keywords == instructions.end() || !keywords->is_array()) return 0;
    std::map<std::string, float> weights;  // in an order that makes the sum the same each time
    for (const Dictionary& keyword : *keywords) {
      if (auto word = stringMember(keyword, "word"))
        weights.insert_or_assign(*std::move(word), floatMember(keyword, "weight"));
    }
    float score = 0;
    for (const auto& [word, weight] : weights) {
      if (contains(word)) score += weight;
    }
    return score;
  }

  /// Of the sets of words; 0 where one of them is empty.
  float jaccardIndex(std::string_view subject) {
    if (!words_) words_ = wordsOf(text_);
    const auto others = wordsOf(subject);
    if (words_->empty() || others.empty()) return 0;
    std::size_t common = 0;
    for (const std::string& word : others) common += words_->count(word);
    return static_cast<float>(common) / static_cast<float>(words_->size() + others.size() - common);
  }

 private:
  std::set<std::string> wordsOf(std::string_view text) const {
    auto words = Lookup::tokenize(text, device_);
    return {std::make_move_iterator(words.begin()), std::make_move_iterator(words.end())};
  }

  platform::Platform& device_;
  platform::WordTokenizer& tokenizer_;
  const std::string locale_;
  const std::string_view text_;
  const std::string folded_;
  std::optional<std::set<std::string>> words_;
};

bool fits(const Dictionary& result, Context& context) {
  if (!result.is_object()) return true;
  const auto instructions = result.find("lookup_instructions");
  if (instructions == result.end() || !instructions->is_object()) return true;

  const float score = context.keywordScore(*instructions);
  const float minimumScore = floatMember(*instructions, "min_keywords_score");
  const bool completionExists = context.contains(stringMember(*instructions, "completion").value_or(""));
  if (score < minimumScore || !completionExists) {
    log().info("dropping lookup result. keyword score: {:f} min keyword score: {:f} completion exists: {:d}",
               score, minimumScore, completionExists);
    return false;
  }
  const float minimumIndex = floatMember(*instructions, "min_subject_score");
  if (minimumIndex <= 0) return true;
  const float index = context.jaccardIndex(stringMember(*instructions, "subject").value_or(""));
  if (index >= minimumIndex) return true;
  log().info("dropping lookup result. jaccard index: {:f} min subject score: {:f}", index, minimumIndex);
  return false;
}

}  // namespace

void Lookup::filterLookupResultsWithRequest(const SBLLookupRequest& request, Dictionary& response,
                                            platform::Platform& device) {
  if (!response.is_array()) {
    log().error("lookup response is not an array. who knows what this is: {}", compactJSON(response));
    return;
  }
  if (response.empty()) {
    // The words of the request are the user's, and stay out of the log.
    log().standard("no data to process for lookup response. request: {} {} response: {}", request.kClassName,
                   request.queryId, compactJSON(response));
    return;
  }
  Context context(request.queryContext ? std::string_view(*request.queryContext) : std::string_view(),
                  device);
  for (Dictionary& item : response) {
    if (!item.is_object()) continue;
    Dictionary kept = Dictionary::array();
    if (const auto results = item.find("results"); results != item.end() && results->is_array()) {
      for (Dictionary& result : *results) {
        if (fits(result, context)) kept.push_back(std::move(result));
      }
    }
    item["results"] = std::move(kept);
  }
}

std::vector<std::string> Lookup::tokenize(std::string_view text, platform::Platform& device) {
  return device.wordTokenizer().words(text, device.localeInfo().localeIdentifier());
}

}  // namespace sable

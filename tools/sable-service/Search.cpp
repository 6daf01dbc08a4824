#include "Search.h"

#include <fmt/format.h>

#include <algorithm>
#include <array>
#include <charconv>
#include <cmath>

namespace service {

namespace {

constexpr size_t kPage = 10;
constexpr int kMaxAge = 300;

/// Lower-case, with single spaces between words; a space at the end stays, for it ends the last word.
std::string normalised(const std::string& typed) {
  std::string text;
  for (const char c : lowercase(typed)) {
    const bool isSpace = c == ' ' || (c >= '\t' && c <= '\r');
    if (!isSpace)
      text += c;
    else if (!text.empty() && text.back() != ' ')
      text += ' ';
  }
  return text;
}

std::string trimmed(std::string text) {
  text.erase(text.find_last_not_of(' ') + 1);
  return text;
}

double rounded(double value) {
  return std::round(value * 1e4) / 1e4;
}

Json emptySet(const std::string& query) {
  return {{"query", query},
          {"completion_score", 0.0},
          {"max_age", kMaxAge},
          {"status", "OK"},
          {"results", Json::array()}};
}

/// The word itself, then what it may be a form of (WordNet's own endings, most likely first).
std::vector<std::string> baseForms(const std::string& word) {
  static constexpr std::array<std::pair<std::string_view, std::string_view>, 8> kEndings = {{{"ies", "y"},
                                                                                             {"es", ""},
                                                                                             {"s", ""},
                                                                                             {"ed", "e"},
                                                                                             {"ed", ""},
                                                                                             {"ing", "e"},
                                                                                             {"ing", ""},
                                                                                             {"men", "man"}}};
  std::vector<std::string> forms = {word};
  for (const auto& [ending, base] : kEndings) {
    if (word.ends_with(ending))
      forms.push_back(word.substr(0, word.size() - ending.size()) + std::string(base));
  }
  return forms;
}

Json section(const std::string& type, const std::string& title, const std::string& text) {
  return {{"type", type}, {"title", title}, {"text", text}};
}

}  // namespace

Answer Search::search(const Request& request) const {
  if (request.item("ltype")) return lookUp(request);
  Json sets = Json::array();
  const std::string query = normalised(request.item("q").value_or(""));
  if (request.item("qtype") == "zkw") {
    sets = {suggestions(Corpus::dictionary, "Common words"),
            suggestions(Corpus::packages, "Popular packages")};
  } else {
    for (const auto corpus : kCorpora) {
      if (const auto completion = index_.complete(corpus, query))
        sets.push_back(resultSet(corpus, *completion));
    }
  }
  if (sets.empty()) sets.push_back(emptySet(query));
  return Answer::json(sets);
}

Json Search::resultSet(Corpus corpus, const Completion& completion) const {
  const auto hits = index_.find(corpus, trimmed(completion.text));
  Json set = emptySet(completion.text);
  set["completion_score"] = rounded(completion.score);
  set["name"] = nameOf(corpus);
  set["results"] = results(corpus, hits, 0);
  if (hits.size() <= kPage) return set;
  const std::string more = moreUrl(corpus, completion.text, kPage);
  set["more_results_url"] = more;
  for (auto& result : set["results"]) result["more_results_url"] = more;
  return set;
}

Json Search::suggestions(Corpus corpus, const std::string& title) const {
  Json set = emptySet("");
  set["name"] = nameOf(corpus);
  set["title"] = title;
  for (auto& entry : index_.best(corpus, kPage))
    set["results"].push_back(result(corpus, {std::move(entry), true, true}));
  return set;
}

Json Search::results(Corpus corpus, const std::vector<Hit>& hits, size_t offset) const {
  Json list = Json::array();
  for (size_t i = offset; i < std::min(hits.size(), offset + kPage); ++i)
    list.push_back(result(corpus, hits[i]));
  return list;
}

Json Search::result(Corpus corpus, const Hit& hit) const {
  const auto& entry = hit.entry;
  const double weight = std::log1p(static_cast<double>(entry.weight));
  const double greatest = std::log1p(static_cast<double>(index_.greatestWeight(corpus)));
  const double share = greatest > 0 ? weight / greatest : 0;
  const bool isWord = corpus == Corpus::dictionary;
  return {{"id", entry.reference},
          {"type", nameOf(corpus)},
          {"title", entry.title},
          {"subtitle", isWord ? entry.section : entry.detail},
          {"description", entry.text},
          {"url", entry.url.empty() ? cardUrl(entry) : entry.url},
          {"score", rounded((hit.inNames ? 0.5 : 0) + 0.5 * share)},
          {"image", imageOf(entry)},
          {"card_url", cardUrl(entry)}};
}

/// Words share the image of their part of speech, known by its id alone; a package has one of its own.
Json Search::imageOf(const Entry& entry) const {
  const std::string id = "section." + entry.section;
  if (entry.section != "package") return {{"id", id}};
  const std::string url = fmt::format("{}/images/{}.png", base_, entry.reference);
  if (entry.url.empty()) return {{"url", url}};
  return {{"url", url}, {"id", id}};
}

std::string Search::cardUrl(const Entry& entry) const {
  return fmt::format("{}/card?id={}", base_, percentEncode(entry.reference));
}

std::string Search::moreUrl(Corpus corpus, const std::string& query, size_t offset) const {
  return fmt::format("{}/more?q={}&set={}&offset={}", base_, percentEncode(query), nameOf(corpus), offset);
}

Answer Search::lookUp(const Request& request) const {
  const std::string typed = request.item("q").value_or("");
  const std::string query = trimmed(normalised(typed));
  std::vector<Hit> hits;
  for (const auto& form : baseForms(query)) {
    if (hits.empty()) hits = index_.lookUp(form);
  }
  const bool isMeant = !hits.empty();
  if (!isMeant) {
    if (const auto completion = index_.complete(Corpus::dictionary, query)) {
      hits = index_.find(Corpus::dictionary, completion->text);
    }
  }
  Json found = results(Corpus::dictionary, hits, 0);
  if (!isMeant && request.item("ltype") == "hint") {
    // Nobody asked for a hint: what only begins like this had better stand in the text.
    for (Json& result : found) result["lookup_instructions"] = {{"completion", result["title"]}};
  }
  return Answer::json(Json::array({{{"query", typed}, {"status", "OK"}, {"results", std::move(found)}}}));
}

Answer Search::more(const Request& request) const {
  const std::string query = request.item("q").value_or("");
  const std::string offsetText = request.item("offset").value_or("0");
  const auto corpus = std::ranges::find(kCorpora, request.item("set").value_or("dictionary"), nameOf);
  size_t offset = 0;
  const char* end = offsetText.data() + offsetText.size();
  const bool isNumber = std::from_chars(offsetText.data(), end, offset).ptr == end && !offsetText.empty();
  if (corpus == kCorpora.end() || !isNumber) return Answer::error(400, "set or offset is wrong");
  const auto hits = index_.find(*corpus, trimmed(normalised(query)));
  offset = std::min(offset, hits.size());
  Json page = {{"query", query},
               {"set", nameOf(*corpus)},
               {"offset", offset},
               {"results", results(*corpus, hits, offset)}};
  if (hits.size() > offset + kPage) page["more_results_url"] = moreUrl(*corpus, query, offset + kPage);
  return Answer::json(page);
}

Answer Search::card(const Request& request) const {
  const auto entry = index_.entry(request.item("id").value_or(""));
  if (!entry) return Answer::error(404, "there is no such card");
  Json sections = Json::array();
  sections.push_back(section("text", entry->section, entry->text));
  sections.back()["image"] = imageOf(*entry);
  if (entry->names != entry->title) sections.push_back(section("list", "Synonyms", entry->names));
  if (!entry->detail.empty()) sections.push_back(section("text", "Version", entry->detail));
  const std::string pictures = fmt::format("{}/images/{}", base_, entry->reference);
  sections.push_back(
      {{"type", "images"}, {"images", {{{"url", pictures + "-1.png"}}, {{"url", pictures + "-2.png"}}}}});
  return Answer::json({{"card",
                        {{"id", entry->reference},
                         {"title", entry->title},
                         {"url", entry->url.empty() ? cardUrl(*entry) : entry->url},
                         {"image", imageOf(*entry)},
                         {"card_sections", std::move(sections)}}}});
}

}  // namespace service

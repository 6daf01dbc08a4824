#pragma once

#include <string>

#include "Index.h"
#include "Message.h"

namespace service {

/// The answers made from the index. All URLs in them begin with `base`. Safe from any thread.
///
/// A result: {"id", "type", "title", "subtitle", "description", "url", "score", "image" {"url"} and/or
/// {"id"}, "card_url", and "more_results_url" where its set has more}.
class Search {
 public:
  Search(const Index& index, std::string base) : index_(index), base_(std::move(base)) {}

  /// GET /search: an array of result sets, one each for the dictionary and the packages that has a completion
  /// of q; with qtype=zkw suggestions for no text at all; where nothing is found one set with no results.
  /// With an item "ltype" the same as lookUp.
  Answer search(const Request& request) const;
  /// An array of one result set {"query", "results": [...]}: the meanings of the word q or of what it is a
  /// form of, else what begins with it; for a hint with "lookup_instructions" that the text it was taken from
  /// has all of that.
  Answer lookUp(const Request& request) const;
  /// GET /more?q=&set=&offset=: {"query", "set", "offset", "results", "more_results_url" where there is
  /// more}.
  Answer more(const Request& request) const;
  /// GET /card?id=: {"card": {"id", "title", "url", "image", "card_sections": [...]}}.
  Answer card(const Request& request) const;

 private:
  Json resultSet(Corpus corpus, const Completion& completion) const;
  Json suggestions(Corpus corpus, const std::string& title) const;
  Json results(Corpus corpus, const std::vector<Hit>& hits, size_t offset) const;
  Json result(Corpus corpus, const Hit& hit) const;
  Json imageOf(const Entry& entry) const;
  std::string cardUrl(const Entry& entry) const;
  std::string moreUrl(Corpus corpus, const std::string& query, size_t offset) const;

  const Index& index_;
  const std::string base_;
};

}  // namespace service

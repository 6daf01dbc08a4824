#pragma once

#include <memory>
#include <mutex>

#include "platform/WordTokenizer.h"

namespace sable::platform {

/// Words by ICU's break iterator (Unicode Standard Annex 29 and dictionaries), folding by Unicode's
/// NFKC_Casefold after the two letters that Turkish and Azerbaijani pair otherwise.
class ICUWordTokenizer final : public WordTokenizer {
 public:
  ICUWordTokenizer();
  ~ICUWordTokenizer() override;

  std::vector<std::string> words(std::string_view text, const std::string& locale) override;
  std::string folded(std::string_view text, const std::string& locale) override;
  bool contains(std::string_view foldedText, std::string_view foldedPart) override;

 private:
  struct Breaks;

  std::mutex mutex_;
  std::shared_ptr<const Breaks> breaks_;  ///< of the locale that was asked for last
};

}  // namespace sable::platform

#include "platform/ICUWordTokenizer.h"

#include <unicode/brkiter.h>
#include <unicode/bytestream.h>
#include <unicode/normalizer2.h>
#include <unicode/uchar.h>
#include <unicode/unistr.h>

#include "platform/Log.h"

namespace sable::platform {

/// What making an iterator costs is the rules of its locale; copies share them.
struct ICUWordTokenizer::Breaks {
  explicit Breaks(const std::string& name) : identifier(name), locale(name.c_str()) {
    UErrorCode status = U_ZERO_ERROR;
    iterator.reset(icu::BreakIterator::createWordInstance(locale, status));
    if (U_SUCCESS(status)) return;
    iterator.reset();
    platformLog().error("no words in {}: {}", name, u_errorName(status));
  }

  const std::string identifier;
  const icu::Locale locale;
  std::unique_ptr<const icu::BreakIterator> iterator;  ///< may be null
};

namespace {

/// Both fail only where ICU comes without its own data, which a package of it does not.
const icu::Normalizer2& composing() {
  UErrorCode status = U_ZERO_ERROR;
  return *icu::Normalizer2::getNFCInstance(status);
}
const icu::Normalizer2& caseFolding() {
  UErrorCode status = U_ZERO_ERROR;
  return *icu::Normalizer2::getNFKCCasefoldInstance(status);
}

icu::UnicodeString composed(std::string_view text) {
  UErrorCode status = U_ZERO_ERROR;
  return composing().normalize(
      icu::UnicodeString::fromUTF8({text.data(), static_cast<std::int32_t>(text.size())}), status);
}

bool pairsDotlessI(const std::string& locale) {
  const std::string_view language(locale.data(), std::min(locale.find_first_of("-_@"), locale.size()));
  return language == "tr" || language == "az";
}

/// Whether what stands at a place belongs to the character before it.
bool continues(std::string_view text, std::size_t place) {
  if (place >= text.size()) return false;
  const std::string_view next = text.substr(place, 4);  // as long as a character can be
  const UChar32 character =
      icu::UnicodeString::fromUTF8({next.data(), static_cast<std::int32_t>(next.size())}).char32At(0);
  const auto part = u_getIntPropertyValue(character, UCHAR_GRAPHEME_CLUSTER_BREAK);
  return part == U_GCB_EXTEND || part == U_GCB_SPACING_MARK || part == U_GCB_ZWJ;
}

}  // namespace

ICUWordTokenizer::ICUWordTokenizer() = default;
ICUWordTokenizer::~ICUWordTokenizer() = default;

std::vector<std::string> ICUWordTokenizer::words(std::string_view text, const std::string& locale) {
  std::shared_ptr<const Breaks> breaks;
  {
    const std::lock_guard lock(mutex_);
    if (breaks_ == nullptr || breaks_->identifier != locale) breaks_ = std::make_shared<const Breaks>(locale);
    breaks = breaks_;
  }
  if (breaks->iterator == nullptr) return {};
  const icu::UnicodeString characters = composed(text);
  const std::unique_ptr<icu::BreakIterator> iterator(breaks->iterator->clone());
  iterator->setText(characters);
  std::vector<std::string> words;
  for (std::int32_t start = iterator->first(), end = iterator->next(); end != icu::BreakIterator::DONE;
       start = end, end = iterator->next()) {
    if (iterator->getRuleStatus() < UBRK_WORD_NONE_LIMIT) continue;
    icu::UnicodeString word(characters, start, end - start);
    word.toLower(breaks->locale).toUTF8String(words.emplace_back());
  }
  return words;
}

std::string ICUWordTokenizer::folded(std::string_view text, const std::string& locale) {
  std::string turkish;
  if (pairsDotlessI(locale)) {
    composed(text).foldCase(U_FOLD_CASE_EXCLUDE_SPECIAL_I).toUTF8String(turkish);
    text = turkish;
  }
  std::string result;
  icu::StringByteSink<std::string> sink(&result);
  UErrorCode status = U_ZERO_ERROR;
  caseFolding().normalizeUTF8(0, {text.data(), static_cast<std::int32_t>(text.size())}, sink, nullptr,
                              status);
  return result;
}

bool ICUWordTokenizer::contains(std::string_view foldedText, std::string_view foldedPart) {
  if (foldedPart.empty()) return true;
  for (auto at = foldedText.find(foldedPart); at != std::string_view::npos;
       at = foldedText.find(foldedPart, at + 1)) {
    if ((at == 0 || !continues(foldedText, at)) && !continues(foldedText, at + foldedPart.size()))
      return true;
  }
  return false;
}

}  // namespace sable::platform

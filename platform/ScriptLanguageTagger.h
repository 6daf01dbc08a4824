#pragma once

#include "platform/LanguageTagger.h"

namespace sable::platform {

/// Looks at the script first: kana, Hangul, Thai and the like belong to one language, and where a
/// few share a script the first hint that is written in it decides (Han without one is "zh"). For
/// Latin and Cyrillic asks CLD2 and believes it only where it calls itself reliable, for a query
/// of a word or two fools it; then the first hint written in that script; else "und". Any thread.
class ScriptLanguageTagger final : public LanguageTagger {
 public:
  std::string dominantLanguage(std::string_view text, std::span<const std::string> hints) override;
};

}  // namespace sable::platform

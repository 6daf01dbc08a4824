#pragma once

#include <span>
#include <string>
#include <string_view>

namespace sable::platform {

/// Guesses the language a text is written in. Loads its tables at the first call.
class LanguageTagger {
 public:
  virtual ~LanguageTagger() = default;
  /// BCP 47 tag of the text's language, "und" when it cannot be told. `hints`: languages the user
  /// is likely to write, best first (keyboard, preferred languages).
  virtual std::string dominantLanguage(std::string_view text, std::span<const std::string> hints) = 0;
};

}  // namespace sable::platform

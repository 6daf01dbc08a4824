#include "platform/ScriptLanguageTagger.h"

#include <unicode/uchar.h>
#include <unicode/unistr.h>
#include <unicode/uscript.h>

#include <algorithm>
#include <array>
#include <map>

// clang-format off: the second needs what the first declares
#include <cld2/public/compact_lang_det.h>
#include <cld2/public/encodings.h>

#include <cstdio>
// clang-format on

namespace sable::platform {

namespace {

constexpr std::string_view kUndetermined = "und";

/// A script and the languages written in it, the one it stands for alone first. Latin is what a
/// language not listed is written in.
struct Script {
  UScriptCode code;
  std::array<std::string_view, 8> languages;
};
constexpr std::array kScripts{
    Script{USCRIPT_HIRAGANA, {"ja"}},
    Script{USCRIPT_HANGUL, {"ko"}},
    Script{USCRIPT_HAN, {"zh", "ja", "yue"}},
    Script{USCRIPT_THAI, {"th"}},
    Script{USCRIPT_GREEK, {"el"}},
    Script{USCRIPT_HEBREW, {"he", "yi"}},
    Script{USCRIPT_ARABIC, {"ar", "fa", "ur", "ps", "sd", "ug", "ckb"}},
    Script{USCRIPT_DEVANAGARI, {"hi", "mr", "ne", "sa"}},
    Script{USCRIPT_BENGALI, {"bn", "as"}},
    Script{USCRIPT_GURMUKHI, {"pa"}},
    Script{USCRIPT_GUJARATI, {"gu"}},
    Script{USCRIPT_ORIYA, {"or"}},
    Script{USCRIPT_TAMIL, {"ta"}},
    Script{USCRIPT_TELUGU, {"te"}},
    Script{USCRIPT_KANNADA, {"kn"}},
    Script{USCRIPT_MALAYALAM, {"ml"}},
    Script{USCRIPT_SINHALA, {"si"}},
    Script{USCRIPT_LAO, {"lo"}},
    Script{USCRIPT_TIBETAN, {"bo", "dz"}},
    Script{USCRIPT_MYANMAR, {"my"}},
    Script{USCRIPT_KHMER, {"km"}},
    Script{USCRIPT_GEORGIAN, {"ka"}},
    Script{USCRIPT_ARMENIAN, {"hy"}},
    Script{USCRIPT_ETHIOPIC, {"am", "ti"}},
    Script{USCRIPT_CYRILLIC, {"ru", "uk", "bg", "sr", "be", "mk", "kk", "mn"}},
};

const Script* findScript(UScriptCode code) {
  const auto found = std::ranges::find(kScripts, code, &Script::code);
  return found == kScripts.end() ? nullptr : &*found;
}

bool isWrittenIn(std::string_view language, UScriptCode code) {
  const auto writes = [&](const Script& script) {
    return std::ranges::find(script.languages, language) != script.languages.end();
  };
  if (code == USCRIPT_LATIN) return std::ranges::none_of(kScripts, writes) || language == "sr";
  const Script* script = findScript(code);
  return script != nullptr && writes(*script);
}

/// The language of a tag ("de-CH", "zh_Hant_TW"), in lower case.
std::string primaryLanguage(std::string_view tag) {
  std::string language(tag.substr(0, tag.find_first_of("-_@")));
  std::ranges::transform(language, language.begin(), [](char c) {
    return c >= 'A' && c <= 'Z' ? static_cast<char>(c + ('a' - 'A')) : c;
  });
  return language;
}

std::string firstHintIn(UScriptCode code, std::span<const std::string> hints, std::string_view otherwise) {
  for (const std::string& hint : hints) {
    std::string language = primaryLanguage(hint);
    if (!language.empty() && isWrittenIn(language, code)) return language;
  }
  return std::string(otherwise);
}

/// The script most of the letters are in. Kana make the Han beside them Japanese; both kana count
/// as Hiragana. USCRIPT_COMMON when there are no letters.
UScriptCode dominantScript(std::string_view text) {
  std::map<UScriptCode, int> letters;
  const auto characters = icu::UnicodeString::fromUTF8({text.data(), static_cast<std::int32_t>(text.size())});
  for (std::int32_t i = 0; i < characters.length(); i = characters.moveIndex32(i, 1)) {
    const UChar32 character = characters.char32At(i);
    if (!u_isalpha(character)) continue;
    UErrorCode status = U_ZERO_ERROR;
    const UScriptCode script = uscript_getScript(character, &status);
    if (script == USCRIPT_COMMON || script == USCRIPT_INHERITED) continue;
    ++letters[script == USCRIPT_KATAKANA ? USCRIPT_HIRAGANA : script];
  }
  if (const auto kana = letters.find(USCRIPT_HIRAGANA); kana != letters.end()) {
    kana->second += letters[USCRIPT_HAN];
    letters.erase(USCRIPT_HAN);
  }
  const auto most = std::ranges::max_element(letters, {}, [](const auto& entry) { return entry.second; });
  return most == letters.end() ? USCRIPT_COMMON : most->first;
}

/// The code BCP 47 has in place of the withdrawn ones that CLD2 still answers with.
std::string currentCode(std::string_view code) {
  if (code == "iw") return "he";
  if (code == "jw") return "jv";
  if (code == "in") return "id";
  if (code == "ji") return "yi";
  if (code == "mo") return "ro";
  return primaryLanguage(code);
}

std::string reliableGuess(std::string_view text, std::span<const std::string> hints) {
  std::string languages;
  for (const std::string& hint : hints) languages += (languages.empty() ? "" : ",") + primaryLanguage(hint);
  const CLD2::CLDHints given{languages.c_str(), nullptr, CLD2::UNKNOWN_ENCODING, CLD2::UNKNOWN_LANGUAGE};
  std::array<CLD2::Language, 3> ranked{};
  std::array<int, 3> percent{};
  std::array<double, 3> score{};
  int textBytes = 0;
  bool reliable = false;
  int validBytes = 0;
  const CLD2::Language guess = CLD2::ExtDetectLanguageSummaryCheckUTF8(
      text.data(), static_cast<int>(text.size()), true, &given, 0, ranked.data(), percent.data(),
      score.data(), nullptr, &textBytes, &reliable, &validBytes);
  if (!reliable || guess == CLD2::UNKNOWN_LANGUAGE) return {};
  return currentCode(CLD2::LanguageCode(guess));
}

/// As much of a text as settles it, cut between characters.
std::string_view beginning(std::string_view text) {
  constexpr std::size_t enough = 4096;
  if (text.size() <= enough) return text;
  std::size_t end = enough;
  while (end > 0 && (static_cast<unsigned char>(text[end]) & 0xC0) == 0x80) --end;
  return text.substr(0, end);
}

}  // namespace

std::string ScriptLanguageTagger::dominantLanguage(std::string_view text,
                                                   std::span<const std::string> hints) {
  text = beginning(text);
  const UScriptCode code = dominantScript(text);
  if (code == USCRIPT_COMMON) return std::string(kUndetermined);
  const Script* script = findScript(code);
  if (script != nullptr && code != USCRIPT_CYRILLIC)
    return firstHintIn(code, hints, script->languages.front());
  if (std::string guess = reliableGuess(text, hints); !guess.empty()) return guess;
  return firstHintIn(code, hints, kUndetermined);
}

}  // namespace sable::platform

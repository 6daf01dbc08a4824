#include <gtest/gtest.h>

#include <vector>

#include "platform/ScriptLanguageTagger.h"

namespace sable::platform {
namespace {

TEST(LanguageTaggerTest, ScriptThenReliableGuessThenHintThenNothing) {
  struct Case {
    std::string text;
    std::vector<std::string> hints;
    std::string language;
  };
  const Case cases[] = {
      // The script alone decides.
      {"東京の天気", {"zh"}, "ja"},
      {"コーヒー", {}, "ja"},
      {"안녕", {"ja"}, "ko"},
      {"สวัสดี", {}, "th"},
      {"καφές", {}, "el"},
      {"天气", {}, "zh"},
      {"restaurant 東京の天気予報を教えて", {"en"}, "ja"},
      // Of languages that share a script the first hint that is written in it.
      {"北京", {"en-GB", "zh-Hant-TW"}, "zh"},
      {"東京", {"en", "ja_JP", "zh"}, "ja"},
      {"شکر", {"fa-IR"}, "fa"},
      {"مرحبا", {"en"}, "ar"},
      // Enough text for a reliable guess, whatever the hints.
      {"Où est la bibliothèque la plus proche de chez moi", {"en"}, "fr"},
      {"как дела сегодня в москве", {}, "ru"},
      // Too little: the first hint in that script, else nothing.
      {"pizza", {"el", "de-CH", "fr"}, "de"},
      {"pizza", {"ru", "ja"}, "und"},
      {"pizza", {}, "und"},
      {"погода", {"en", "uk"}, "uk"},
      // No letters.
      {"", {"en"}, "und"},
      {"123 + 4 = €127 😀", {"en"}, "und"},
      {"\xff\xfe\x80", {"en"}, "und"},
  };
  ScriptLanguageTagger tagger;
  for (const Case& each : cases)
    EXPECT_EQ(tagger.dominantLanguage(each.text, each.hints), each.language) << each.text;
}

TEST(LanguageTaggerTest, LongTextsAreCutBetweenCharacters) {
  std::string text;
  while (text.size() < 5000) text += "à la bibliothèque française où l'été est déjà passé, ";
  for (std::size_t shift = 0; shift < 4; ++shift) {
    EXPECT_EQ(ScriptLanguageTagger().dominantLanguage(std::string(shift, ' ') + text, {}), "fr");
  }
}

}  // namespace
}  // namespace sable::platform

#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace sable::platform {

/// Words and letter case by the rules of a locale ("de_DE", "tr"). Loads its tables at the first
/// call. Any thread.
class WordTokenizer {
 public:
  virtual ~WordTokenizer() = default;

  /// The words of a text in order and in lower case (of the locale: in Turkish "I" becomes "ı"),
  /// where languages without spaces write them, too. Spaces, punctuation and pictures are no words;
  /// numbers are.
  virtual std::vector<std::string> words(std::string_view text, const std::string& locale) = 0;

  /// A form in which texts that differ only in letter case, width or the way their marks are encoded
  /// are the same. For contains() alone.
  virtual std::string folded(std::string_view text, const std::string& locale) = 0;

  /// Whether one folded text is somewhere in another, beginning and ending between characters as
  /// readers see them: "e" is not in "é". An empty one is in every text.
  virtual bool contains(std::string_view foldedText, std::string_view foldedPart) = 0;
};

}  // namespace sable::platform

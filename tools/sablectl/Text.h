#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

/// Text for a terminal: what comes from outside is made harmless, then measured, cut and padded in
/// columns of the terminal, not in bytes.
namespace sable::sablectl {

enum class Newlines { escape, keep };

/// The text with all that a terminal would obey, or that changes the order in which it is read,
/// written as "\u001b": controls (C0, DEL, C1), bidirectional formatting, line and paragraph
/// separators. Bytes that are not UTF-8 become U+FFFD. Within JSON text the result is JSON again,
/// with the same value.
std::string printable(std::string_view text, Newlines newlines = Newlines::escape);

/// Columns that printable text takes (Unicode Standard Annex 11: wide characters take two).
std::size_t displayWidth(std::string_view text);

/// The text, if it fits, else its beginning with "…" at the end; at most `width` columns.
std::string cut(std::string_view text, std::size_t width);

/// The text's words in lines of at most `width` columns; a longer word stands alone.
std::vector<std::string> wrapped(std::string_view text, std::size_t width);

/// The text with blanks behind it up to `width` columns.
std::string padded(std::string_view text, std::size_t width);

/// "3 h 59 min", "12 s": the two largest units of that many seconds, without a sign.
std::string duration(std::int64_t seconds);

/// The text's code points, each as UTF-8; marks that combine stay with what they stand on.
std::vector<std::string> characters(std::string_view text);

/// "3 h 59 min", "12 s": the two largest units; without a sign.
std::string durationText(std::int64_t seconds);

}  // namespace sable::sablectl

#include "tools/sablectl/Text.h"

#include <fmt/format.h>
#include <unicode/uchar.h>
#include <unicode/utext.h>

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <functional>

namespace sable::sablectl {
namespace {

constexpr UChar32 kReplacement = 0xFFFD;

/// Calls `visit` with each code point and its bytes.
void forEachCodePoint(std::string_view text, const std::function<void(UChar32, std::string_view)>& visit) {
  UErrorCode status = U_ZERO_ERROR;
  UText reader = UTEXT_INITIALIZER;
  utext_openUTF8(&reader, text.data(), static_cast<std::int64_t>(text.size()), &status);
  std::size_t start = 0;
  for (UChar32 point; (point = utext_next32(&reader)) != U_SENTINEL;) {
    const auto end = static_cast<std::size_t>(utext_getNativeIndex(&reader));
    visit(point, text.substr(start, end - start));
    start = end;
  }
  utext_close(&reader);
}

bool isHarmful(UChar32 point) {
  if (u_iscntrl(point)) return true;
  return point == 0x2028 || point == 0x2029 || u_hasBinaryProperty(point, UCHAR_BIDI_CONTROL);
}

bool combines(UChar32 point) {
  constexpr std::uint32_t kMarks = U_GC_MN_MASK | U_GC_ME_MASK | U_GC_CF_MASK;
  return (U_MASK(u_charType(point)) & kMarks) != 0;
}

std::size_t columns(UChar32 point) {
  if (combines(point)) return 0;
  const int width = u_getIntPropertyValue(point, UCHAR_EAST_ASIAN_WIDTH);
  return width == U_EA_WIDE || width == U_EA_FULLWIDTH ? 2 : 1;
}

}  // namespace

std::string printable(std::string_view text, Newlines newlines) {
  std::string result;
  result.reserve(text.size());
  forEachCodePoint(text, [&](UChar32 point, std::string_view bytes) {
    if (point == '\n' && newlines == Newlines::keep) {
      result += '\n';
    } else if (isHarmful(point)) {
      fmt::format_to(std::back_inserter(result), "\\u{:04x}", static_cast<std::uint32_t>(point));
    } else if (point == kReplacement) {
      result += "\uFFFD";
    } else {
      result += bytes;
    }
  });
  return result;
}

std::size_t displayWidth(std::string_view text) {
  std::size_t width = 0;
  forEachCodePoint(text, [&](UChar32 point, std::string_view) { width += columns(point); });
  return width;
}

std::string cut(std::string_view text, std::size_t width) {
  if (displayWidth(text) <= width) return std::string(text);
  if (width == 0) return {};
  std::string result;
  std::size_t used = 1;  // the ellipsis
  bool full = false;
  forEachCodePoint(text, [&](UChar32 point, std::string_view bytes) {
    used += columns(point);
    full = full || used > width;
    if (!full) result += bytes;
  });
  return result + "…";
}

std::string padded(std::string_view text, std::size_t width) {
  const std::size_t taken = displayWidth(text);
  return std::string(text) + std::string(taken < width ? width - taken : 0, ' ');
}

std::string duration(std::int64_t seconds) {
  const std::int64_t whole = std::abs(seconds);
  if (whole >= 86400) return fmt::format("{} d {} h", whole / 86400, whole % 86400 / 3600);
  if (whole >= 3600) return fmt::format("{} h {} min", whole / 3600, whole % 3600 / 60);
  if (whole >= 60) return fmt::format("{} min {} s", whole / 60, whole % 60);
  return fmt::format("{} s", whole);
}

std::vector<std::string> characters(std::string_view text) {
  std::vector<std::string> result;
  forEachCodePoint(text, [&](UChar32 point, std::string_view bytes) {
    if (combines(point) && !result.empty()) {
      result.back() += bytes;
    } else {
      result.emplace_back(bytes);
    }
  });
  return result;
}

std::vector<std::string> wrapped(std::string_view text, std::size_t width) {
  std::vector<std::string> lines;
  while (!text.empty()) {
    const std::string word(text.substr(0, text.find(' ')));
    text.remove_prefix(std::min(text.size(), word.size() + 1));
    if (lines.empty() || displayWidth(lines.back()) + 1 + displayWidth(word) > width) {
      lines.push_back(word);
    } else {
      lines.back().append(" ").append(word);
    }
  }
  return lines;
}

std::string durationText(std::int64_t seconds) {
  const std::int64_t whole = std::abs(seconds);
  if (whole >= 86400) return fmt::format("{} d {} h", whole / 86400, whole % 86400 / 3600);
  if (whole >= 3600) return fmt::format("{} h {} min", whole / 3600, whole % 3600 / 60);
  if (whole >= 60) return fmt::format("{} min {} s", whole / 60, whole % 60);
  return fmt::format("{} s", whole);
}

}  // namespace sable::sablectl

#pragma once

#include <cstdint>
#include <nlohmann/json_fwd.hpp>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Error.h"

namespace sable {

/// A JSON value whose objects keep the order of insertion: the raw bag, user info, settings and
/// facts. Its definition is heavy: include <nlohmann/json.hpp> in sources only.
using Dictionary = nlohmann::ordered_json;

/// JSON is refused beyond this nesting (RFC 8259 section 9 leaves such limits to the reader).
inline constexpr int kMaximumJSONDepth = 512;

/// Errors of reading JSON.
inline constexpr std::string_view kJSONErrorDomain = "JSONErrorDomain";
enum class JSONErrorCode : std::int64_t { malformed = 1, tooLong = 2, tooDeep = 3 };

/// Parses RFC 8259 text: UTF-8 only, at most `maximumBytes` long, nested at most
/// kMaximumJSONDepth deep. Of members with one name the last value counts. The error (of
/// kJSONErrorDomain) says what is wrong and at which byte, counted from 0. Takes time linear in
/// the length, whatever the text.
Expected<Dictionary> parseJSON(std::string_view text, std::size_t maximumBytes);

/// Compact UTF-8 JSON. Strings that are not UTF-8 have their bad bytes replaced by U+FFFD.
std::string compactJSON(const Dictionary& value);

// Typed members of an object: absent, or of another type, is nullopt. `object` may be any value.
std::optional<std::string> stringMember(const Dictionary& object, std::string_view key);
std::optional<double> numberMember(const Dictionary& object, std::string_view key);
std::optional<std::int64_t> integerMember(const Dictionary& object, std::string_view key);
std::optional<bool> booleanMember(const Dictionary& object, std::string_view key);
std::optional<std::vector<std::string>> stringsMember(const Dictionary& object, std::string_view key);

}  // namespace sable

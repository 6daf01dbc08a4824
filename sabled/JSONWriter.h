#pragma once

#include <concepts>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Dictionary.h"

namespace sable {

/// The place of one value in compact JSON text (RFC 8259), at the end of a string. The text is what
/// compactJSON() makes of the same value, without a tree in between. Each place takes one value,
/// before there is another place.
class JSONPlace {
 public:
  /// `text` is the caller's, and outlives the place.
  explicit JSONPlace(std::string& text) : text_(text) {}

  void operator=(std::nullptr_t) { text_ += "null"; }
  void operator=(double value);  ///< null for what is not finite
  /// Bad UTF-8 is replaced by U+FFFD.
  void operator=(std::string_view value);
  void operator=(const char* value) { *this = std::string_view(value); }
  void operator=(const std::string& value) { *this = std::string_view(value); }
  void operator=(std::optional<std::string_view> value);  ///< nothing is null
  void operator=(const Dictionary& value) { text_ += compactJSON(value); }
  void operator=(std::integral auto value) {
    if constexpr (std::same_as<decltype(value), bool>) {
      text_ += value ? "true" : "false";
    } else if constexpr (std::signed_integral<decltype(value)>) {
      writeSigned(value);
    } else {
      writeUnsigned(value);
    }
  }

 private:
  friend class JSONObject;
  friend class JSONArray;

  void writeSigned(std::int64_t value);
  void writeUnsigned(std::uint64_t value);

  std::string& text_;
};

/// An object that is being written; it ends with its lifetime.
class JSONObject {
 public:
  explicit JSONObject(JSONPlace place) : text_(place.text_) { text_ += '{'; }
  ~JSONObject() { text_ += '}'; }
  JSONObject(const JSONObject&) = delete;
  JSONObject& operator=(const JSONObject&) = delete;

  /// The place of the next member. Each key once: there is no way back.
  JSONPlace operator[](std::string_view key);

 private:
  std::string& text_;
};

/// An array that is being written; it ends with its lifetime.
class JSONArray {
 public:
  explicit JSONArray(JSONPlace place) : text_(place.text_) { text_ += '['; }
  ~JSONArray() { text_ += ']'; }
  JSONArray(const JSONArray&) = delete;
  JSONArray& operator=(const JSONArray&) = delete;

  JSONPlace next();

 private:
  std::string& text_;
};

}  // namespace sable

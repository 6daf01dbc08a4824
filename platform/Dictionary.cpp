#include "platform/Dictionary.h"

#include <fmt/core.h>

#include <algorithm>
#include <nlohmann/json.hpp>
#include <unordered_map>

namespace sable {

namespace {

tl::unexpected<Error> jsonError(JSONErrorCode code, std::string reason) {
  return tl::unexpected(
      Error{std::string(kJSONErrorDomain), static_cast<std::int64_t>(code), std::move(reason)});
}

/// The offset of the bracket that opens one level too many. Exact up to the first syntax error,
/// and nothing behind that is ever read.
std::optional<std::size_t> offsetOfExcessiveDepth(std::string_view text) {
  int depth = 0;
  bool inString = false;
  for (std::size_t i = 0; i < text.size(); ++i) {
    const char c = text[i];
    if (inString) {
      if (c == '\\') {
        ++i;
      } else if (c == '"') {
        inString = false;
      }
    } else if (c == '"') {
      inString = true;
    } else if (c == '[' || c == '{') {
      if (++depth > kMaximumJSONDepth) return i;
    } else if (c == ']' || c == '}') {
      --depth;
    }
  }
  return std::nullopt;
}

/// The library's text for a fault, without its own prefix and without the bytes it has read,
/// which need not be UTF-8.
std::string plainReason(std::string_view text) {
  for (std::string_view prefix : {"] ", "parse error at ", ": "}) {
    if (const auto at = text.find(prefix); at != text.npos) text.remove_prefix(at + prefix.size());
  }
  return std::string(text.substr(0, text.find("; last read")));
}

/// Builds the value that the parser reads out. The library's own builder looks every key up among
/// those before it, so that a hostile object of a million keys would cost 10^12 comparisons.
class Builder {
 public:
  using Object = Dictionary::object_t;
  using Members = Object::Container;

  Dictionary take() { return std::move(root_); }
  std::string& reason() { return reason_; }

  bool null() { return add(nullptr); }
  bool boolean(bool value) { return add(value); }
  bool number_integer(std::int64_t value) { return add(value); }
  bool number_unsigned(std::uint64_t value) { return add(value); }
  bool number_float(double value, const std::string&) { return add(value); }
  bool string(std::string& value) { return add(std::move(value)); }
  bool binary(Dictionary::binary_t&) { return false; }
  bool key(std::string& name) {
    key_ = std::move(name);
    return true;
  }
  bool start_object(std::size_t) { return open(Dictionary::object()); }
  bool start_array(std::size_t) { return open(Dictionary::array()); }
  bool end_object() {
    mergeRepeatedKeys(members(*open_.back()));
    return end_array();
  }
  bool end_array() {
    open_.pop_back();
    return true;
  }
  bool parse_error(std::size_t position, const std::string&, const Dictionary::exception& fault) {
    // The library counts bytes from 1.
    reason_ = fmt::format("byte {}: {}", position == 0 ? 0 : position - 1, plainReason(fault.what()));
    return false;
  }

 private:
  static Members& members(Dictionary& object) { return object.get_ref<Object&>(); }

  bool add(Dictionary value) {
    place(std::move(value));
    return true;
  }
  bool open(Dictionary container) {
    open_.push_back(&place(std::move(container)));
    return true;
  }

  Dictionary& place(Dictionary value) {
    if (open_.empty()) return root_ = std::move(value);
    Dictionary& parent = *open_.back();
    if (parent.is_array()) return parent.get_ref<Dictionary::array_t&>().emplace_back(std::move(value));
    return members(parent).emplace_back(std::move(key_), std::move(value)).second;
  }

  /// Of members with one name the last value counts, in the first one's place.
  static void mergeRepeatedKeys(Members& all) {
    std::unordered_map<std::string_view, std::size_t> places;
    places.reserve(all.size());
    for (std::size_t i = 0; i < all.size(); ++i) places.try_emplace(all[i].first, i);
    if (places.size() == all.size()) return;

    for (std::size_t i = 0; i < all.size(); ++i) {
      if (const auto first = places.at(all[i].first); first != i)
        all[first].second = std::move(all[i].second);
    }
    Members kept;
    kept.reserve(places.size());
    for (std::size_t i = 0; i < all.size(); ++i) {
      if (places.at(all[i].first) == i) kept.emplace_back(all[i].first, std::move(all[i].second));
    }
    all.swap(kept);
  }

  Dictionary root_;
  std::vector<Dictionary*> open_;  // a container is complete before its parent grows again
  std::string key_;
  std::string reason_;
};

const Dictionary* member(const Dictionary& object, std::string_view key) {
  if (!object.is_object()) return nullptr;
  for (const auto& [name, value] : object.get_ref<const Dictionary::object_t&>()) {
    if (name == key) return &value;
  }
  return nullptr;
}

}  // namespace

Expected<Dictionary> parseJSON(std::string_view text, std::size_t maximumBytes) {
  if (text.size() > maximumBytes) {
    return jsonError(JSONErrorCode::tooLong,
                     fmt::format("{} bytes, more than the {} allowed", text.size(), maximumBytes));
  }
  if (const auto offset = offsetOfExcessiveDepth(text)) {
    return jsonError(JSONErrorCode::tooDeep,
                     fmt::format("byte {}: nested more than {} deep", *offset, kMaximumJSONDepth));
  }
  Builder builder;
  if (!Dictionary::sax_parse(text.begin(), text.end(), &builder)) {
    return jsonError(JSONErrorCode::malformed, std::move(builder.reason()));
  }
  return builder.take();
}

std::string compactJSON(const Dictionary& value) {
  return value.dump(-1, ' ', false, Dictionary::error_handler_t::replace);
}

std::optional<std::string> stringMember(const Dictionary& object, std::string_view key) {
  const Dictionary* value = member(object, key);
  if (value == nullptr || !value->is_string()) return std::nullopt;
  return value->get_ref<const std::string&>();
}

std::optional<double> numberMember(const Dictionary& object, std::string_view key) {
  const Dictionary* value = member(object, key);
  if (value == nullptr || !value->is_number()) return std::nullopt;
  return value->get<double>();
}

std::optional<std::int64_t> integerMember(const Dictionary& object, std::string_view key) {
  const Dictionary* value = member(object, key);
  if (value == nullptr || !value->is_number_integer()) return std::nullopt;
  if (value->is_number_unsigned() && !std::in_range<std::int64_t>(value->get<std::uint64_t>())) {
    return std::nullopt;
  }
  return value->get<std::int64_t>();
}

std::optional<bool> booleanMember(const Dictionary& object, std::string_view key) {
  const Dictionary* value = member(object, key);
  if (value == nullptr || !value->is_boolean()) return std::nullopt;
  return value->get<bool>();
}

std::optional<std::vector<std::string>> stringsMember(const Dictionary& object, std::string_view key) {
  const Dictionary* value = member(object, key);
  if (value == nullptr || !value->is_array()) return std::nullopt;
  std::vector<std::string> strings;
  for (const Dictionary& element : *value) {
    if (!element.is_string()) return std::nullopt;
    strings.push_back(element.get_ref<const std::string&>());
  }
  return strings;
}

}  // namespace sable

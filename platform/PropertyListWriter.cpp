#include <fmt/core.h>
#include <unicode/ustring.h>

#include <algorithm>
#include <bit>
#include <nlohmann/json.hpp>
#include <optional>
#include <unordered_map>
#include <utility>
#include <vector>

#include "platform/PropertyList.h"

// libplist would write these files, too, but takes time quadratic in their length (9 s for a bag of
// 5 MB), cuts strings at a NUL and knows no integer above INT64_MAX.

namespace sable::platform {

namespace {

void appendBigEndian(std::string& bytes, std::uint64_t value, std::size_t length) {
  while (length-- > 0) bytes += static_cast<char>(value >> 8 * length & 0xFF);
}

/// The least of 1, 2, 4 and 8 bytes that hold a number, as a power of two.
unsigned widthOf(std::uint64_t number) {
  if (number <= 0xFF) return 0;
  if (number <= 0xFFFF) return 1;
  return number <= 0xFFFFFFFF ? 2 : 3;
}

/// Writes one file. Values are numbered first, equal strings with one number, since the width of a
/// reference depends on how many there are. The first fault is kept and ends the numbering.
class Writer {
 public:
  Expected<std::string> write(const Dictionary& root) {
    number(root, 0);
    for (const Object& object : objects_) {
      if (fault_ || bytes_.size() > kMaximumPropertyListBytes) break;
      offsets_.push_back(bytes_.size());
      append(object);
    }
    if (!fault_) appendTrailer();
    if (bytes_.size() > kMaximumPropertyListBytes) fail("too long", PropertyListErrorCode::tooLarge);
    if (fault_) return tl::unexpected(*std::move(fault_));
    return std::move(bytes_);
  }

 private:
  /// A string, or a value with the numbers of what it holds: elements, or keys and then members.
  struct Object {
    const Dictionary* value = nullptr;
    const std::string* text = nullptr;
    std::vector<std::size_t> references = {};
  };

  void fail(std::string reason, PropertyListErrorCode code = PropertyListErrorCode::notEncodable) {
    if (!fault_) {
      fault_ =
          Error{std::string(kPropertyListErrorDomain), static_cast<std::int64_t>(code), std::move(reason)};
    }
  }

  std::size_t number(const Dictionary& value, int depth) {
    if (value.is_string()) return number(value.get_ref<const std::string&>());
    const std::size_t index = objects_.size();
    objects_.push_back({&value});
    if (!value.is_structured()) return index;
    if (depth >= kMaximumJSONDepth) {
      fail(fmt::format("nested more than {} deep", kMaximumJSONDepth));
      return index;
    }
    std::vector<std::size_t> references;
    if (value.is_object()) {
      for (const auto& [key, member] : value.get_ref<const Dictionary::object_t&>()) {
        if (!member.is_null()) references.push_back(number(key));
      }
    }
    for (const Dictionary& element : value) {
      if (!element.is_null() && !fault_) references.push_back(number(element, depth + 1));
    }
    objects_[index].references = std::move(references);
    return index;
  }

  std::size_t number(const std::string& text) {
    const auto [known, isNew] = strings_.try_emplace(text, objects_.size());
    if (isNew) objects_.push_back({nullptr, &text});
    return known->second;
  }

  void append(const Object& object) {
    if (object.text != nullptr) return appendString(*object.text);
    const Dictionary& value = *object.value;
    if (value.is_object()) {
      appendContainer(0xD, object.references.size() / 2, object.references);
    } else if (value.is_array()) {
      appendContainer(0xA, object.references.size(), object.references);
    } else if (value.is_boolean()) {
      bytes_ += value.get<bool>() ? '\x09' : '\x08';
    } else if (value.is_number_float()) {
      bytes_ += '\x23';
      appendBigEndian(bytes_, std::bit_cast<std::uint64_t>(value.get<double>()), 8);
    } else if (value.is_number_unsigned()) {
      appendInteger(value.get<std::uint64_t>());
    } else if (value.is_number_integer()) {
      appendInteger(value.get<std::int64_t>());
    } else {
      fail("null and raw bytes have no counterpart");
    }
  }

  void appendInteger(std::int64_t number) {
    if (number >= 0) return appendInteger(static_cast<std::uint64_t>(number));
    bytes_ += '\x13';
    appendBigEndian(bytes_, static_cast<std::uint64_t>(number), 8);
  }

  /// Eight bytes are signed, so that a number above INT64_MAX takes sixteen.
  void appendInteger(std::uint64_t number) {
    if (!std::in_range<std::int64_t>(number)) {
      bytes_ += '\x14';
      appendBigEndian(bytes_, 0, 8);
      return appendBigEndian(bytes_, number, 8);
    }
    const unsigned width = widthOf(number);
    bytes_ += static_cast<char>(0x10 | width);
    appendBigEndian(bytes_, number, std::size_t{1} << width);
  }

  void appendMarker(unsigned kind, std::size_t size) {
    bytes_ += static_cast<char>(kind << 4 | std::min<std::size_t>(size, 0xF));
    if (size >= 0xF) appendInteger(std::uint64_t{size});
  }

  void appendContainer(unsigned kind, std::size_t size, const std::vector<std::size_t>& references) {
    appendMarker(kind, size);
    const std::size_t width = std::size_t{1} << widthOf(objects_.size());
    for (const std::size_t reference : references) appendBigEndian(bytes_, reference, width);
  }

  void appendString(const std::string& text) {
    const bool ascii = std::ranges::all_of(text, [](char c) { return static_cast<unsigned char>(c) < 0x80; });
    if (ascii) {
      appendMarker(0x5, text.size());
      bytes_ += text;
      return;
    }
    if (text.size() > kMaximumPropertyListBytes) return fail("too long", PropertyListErrorCode::tooLarge);
    std::u16string units(text.size(), u'\0');
    std::int32_t length = 0;
    UErrorCode status = U_ZERO_ERROR;
    u_strFromUTF8(units.data(), static_cast<std::int32_t>(units.size()), &length, text.data(),
                  static_cast<std::int32_t>(text.size()), &status);
    if (U_FAILURE(status)) return fail("a string is not UTF-8");
    units.resize(static_cast<std::size_t>(length));
    appendMarker(0x6, units.size());
    for (const char16_t unit : units) appendBigEndian(bytes_, unit, 2);
  }

  void appendTrailer() {
    const std::size_t table = bytes_.size();
    const std::size_t offsetWidth = std::size_t{1} << widthOf(table);
    for (const std::size_t offset : offsets_) appendBigEndian(bytes_, offset, offsetWidth);
    bytes_.append(6, '\0');
    appendBigEndian(bytes_, offsetWidth, 1);
    appendBigEndian(bytes_, std::size_t{1} << widthOf(objects_.size()), 1);
    appendBigEndian(bytes_, objects_.size(), 8);
    appendBigEndian(bytes_, 0, 8);
    appendBigEndian(bytes_, table, 8);
  }

  std::vector<Object> objects_;  ///< the root is the first
  std::unordered_map<std::string_view, std::size_t> strings_;
  std::string bytes_ = "bplist00";
  std::vector<std::size_t> offsets_;
  std::optional<Error> fault_;
};

}  // namespace

Expected<std::string> encodePropertyList(const Dictionary& value) {
  return Writer().write(value);
}

}  // namespace sable::platform

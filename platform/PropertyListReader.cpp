#include <fmt/core.h>

#include <algorithm>
#include <bit>
#include <nlohmann/json.hpp>
#include <optional>
#include <unordered_set>
#include <utility>

#include "platform/PropertyList.h"

// Not libplist: its reader follows references recursively and copies what they name, so that 600 KiB
// of nested arrays take the stack, and 40 small objects that name each other twice unfold into 2^40.
// A check that rules this out reads the whole object table; it may as well keep what it reads.

namespace sable::platform {

namespace {

constexpr std::string_view kMagic = "bplist00";
constexpr std::size_t kTrailerBytes = 32;
constexpr std::size_t kMaximumUnfoldedBytes = 8 * kMaximumPropertyListBytes;
/// What a value takes in memory besides its text, for the sum above.
constexpr std::size_t kValueBytes = 32;
/// 2001-01-01, from which property lists count, in seconds since 1970.
constexpr double kReferenceDate = 978307200;

std::uint64_t bigEndian(std::string_view bytes) {
  std::uint64_t value = 0;
  for (const char byte : bytes) value = value << 8 | static_cast<unsigned char>(byte);
  return value;
}

std::string base64(std::string_view bytes) {
  constexpr std::string_view digits = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  std::string text;
  text.reserve((bytes.size() + 2) / 3 * 4);
  for (std::size_t i = 0; i < bytes.size(); i += 3) {
    const std::string_view group = bytes.substr(i, 3);
    const std::uint64_t bits = bigEndian(group) << 8 * (3 - group.size());
    for (std::size_t digit = 0; digit < 4; ++digit) {
      text += digit <= group.size() ? digits[bits >> (18 - 6 * digit) & 63] : '=';
    }
  }
  return text;
}

void appendUTF8(std::string& text, std::uint32_t character) {
  const auto tail = [&](unsigned shift) { text += static_cast<char>(0x80 | (character >> shift & 0x3F)); };
  if (character < 0x80) {
    text += static_cast<char>(character);
  } else if (character < 0x800) {
    text += static_cast<char>(0xC0 | character >> 6), tail(0);
  } else if (character < 0x10000) {
    text += static_cast<char>(0xE0 | character >> 12), tail(6), tail(0);
  } else {
    text += static_cast<char>(0xF0 | character >> 18), tail(12), tail(6), tail(0);
  }
}

/// Reads one file. The first fault is kept and ends the reading: from then on every payload is
/// empty and every loop stops, so that not each single step has to be checked.
class Reader {
 public:
  explicit Reader(std::string_view bytes) : bytes_(bytes) {}

  Expected<Dictionary> read() {
    Dictionary result;
    if (readTrailer()) result = value(root_, 0);
    if (fault_) return tl::unexpected(*std::move(fault_));
    return result;
  }

 private:
  /// What stands behind a marker byte: `size` payload units at `at`.
  struct Object {
    unsigned kind = 0;
    std::size_t size = 0;
    std::size_t at = 0;
  };

  bool fail(std::string reason, PropertyListErrorCode code = PropertyListErrorCode::malformed) {
    if (!fault_) {
      fault_ =
          Error{std::string(kPropertyListErrorDomain), static_cast<std::int64_t>(code), std::move(reason)};
    }
    return false;
  }

  bool readTrailer() {
    if (bytes_.size() > kMaximumPropertyListBytes) {
      return fail(fmt::format("{} bytes", bytes_.size()), PropertyListErrorCode::tooLarge);
    }
    if (!bytes_.starts_with(kMagic) || bytes_.size() < kMagic.size() + kTrailerBytes) {
      return fail("not a binary property list");
    }
    const std::size_t end = bytes_.size() - kTrailerBytes;
    const std::string_view trailer = bytes_.substr(end);
    offsetBytes_ = bigEndian(trailer.substr(6, 1));
    referenceBytes_ = bigEndian(trailer.substr(7, 1));
    if (offsetBytes_ < 1 || offsetBytes_ > 8 || referenceBytes_ < 1 || referenceBytes_ > 8) {
      return fail("bad trailer");
    }
    const std::uint64_t objects = bigEndian(trailer.substr(8, 8));
    root_ = bigEndian(trailer.substr(16, 8));
    const std::uint64_t table = bigEndian(trailer.substr(24, 8));
    if (table < kMagic.size() || table > end || objects > (end - table) / offsetBytes_) {
      return fail("bad offset table");
    }
    objects_ = bytes_.substr(0, table);
    offsets_ = bytes_.substr(table, objects * offsetBytes_);
    return true;
  }

  std::string_view payload(std::size_t at, std::size_t count, std::size_t unit = 1) {
    if (fault_) return {};
    if (at > objects_.size() || count > (objects_.size() - at) / unit) {
      fail(fmt::format("byte {}: object runs past the end", at));
      return {};
    }
    return objects_.substr(at, count * unit);
  }

  Object object(std::uint64_t index) {
    if (index >= offsets_.size() / offsetBytes_) {
      fail(fmt::format("no object {}", index));
      return {};
    }
    const std::uint64_t offset = bigEndian(offsets_.substr(index * offsetBytes_, offsetBytes_));
    if (offset < kMagic.size() || offset >= objects_.size()) {
      fail(fmt::format("object {} at byte {}", index, offset));
      return {};
    }
    const auto marker = static_cast<unsigned>(bigEndian(payload(offset, 1)));
    Object result{marker >> 4, marker & 0xF, offset + 1};
    if (result.size == 0xF && result.kind >= 4 && result.kind != 8) readLongSize(result);
    return result;
  }

  /// Sizes from 15 stand in an integer object of their own behind the marker.
  void readLongSize(Object& object) {
    const auto marker = static_cast<unsigned>(bigEndian(payload(object.at, 1)));
    if (marker >> 4 != 1 || (marker & 0xF) > 3) {
      fail(fmt::format("byte {}: bad size", object.at));
      return;
    }
    const std::size_t length = std::size_t{1} << (marker & 0xF);
    object.size = bigEndian(payload(object.at + 1, length));
    object.at += 1 + length;
  }

  void charge(std::size_t bytes) {
    unfolded_ += kValueBytes + bytes;
    if (unfolded_ > kMaximumUnfoldedBytes) fail("unfolds to too much", PropertyListErrorCode::tooLarge);
  }

  Dictionary value(std::uint64_t index, int depth) {
    const Object found = object(index);
    charge(0);
    switch (found.kind) {
      case 0x0:
        return constant(found);
      case 0x1:
        return integer(found);
      case 0x2:
        return real(found);
      case 0x3:
        return real(found) + kReferenceDate;
      case 0x4: {
        const std::string_view data = payload(found.at, found.size);
        charge(data.size() * 4 / 3);
        return base64(data);
      }
      case 0x5:
      case 0x6:
        return string(found);
      case 0x8:
        return bigEndian(payload(found.at, hasSize(found, found.size < 8) ? found.size + 1 : 0));
      case 0xA:
        return array(found, depth);
      case 0xD:
        return dictionary(found, depth);
      default:
        fail(fmt::format("byte {}: unknown kind {:x}", found.at - 1, found.kind));
        return {};
    }
  }

  bool hasSize(const Object& object, bool allowed) {
    return allowed || fail(fmt::format("byte {}: bad size {}", object.at - 1, object.size));
  }

  Dictionary constant(const Object& object) {
    if (object.size == 0) return {};
    if (!hasSize(object, object.size == 0x8 || object.size == 0x9)) return {};
    return object.size == 0x9;
  }

  /// Up to four bytes are unsigned, eight signed; sixteen are how unsigned 64-bit numbers look.
  Dictionary integer(const Object& object) {
    if (!hasSize(object, object.size <= 4)) return {};
    const std::size_t length = std::size_t{1} << object.size;
    const std::string_view digits = payload(object.at, length);
    if (digits.size() < 16) return static_cast<std::int64_t>(bigEndian(digits));
    const std::uint64_t high = bigEndian(digits.substr(0, 8)), low = bigEndian(digits.substr(8));
    if (high != 0) fail(fmt::format("byte {}: integer of more than 64 bits", object.at - 1));
    return low;
  }

  double real(const Object& object) {
    if (!hasSize(object, object.size == 2 || object.size == 3)) return 0;
    if (object.size == 3) return std::bit_cast<double>(bigEndian(payload(object.at, 8)));
    return std::bit_cast<float>(static_cast<std::uint32_t>(bigEndian(payload(object.at, 4))));
  }

  std::string string(const Object& object) {
    if (object.kind == 0x6) return utf16(object);
    if (object.kind != 0x5) fail(fmt::format("byte {}: key is no string", object.at - 1));
    const std::string_view text = payload(object.at, object.size);
    charge(text.size());
    const bool ascii = std::ranges::all_of(text, [](char c) { return static_cast<unsigned char>(c) < 0x80; });
    if (!ascii) fail(fmt::format("byte {}: not ASCII", object.at));
    return std::string(text);
  }

  std::string utf16(const Object& object) {
    const std::string_view units = payload(object.at, object.size, 2);
    charge(units.size() * 3 / 2);
    std::string text;
    for (std::size_t i = 0; i < units.size(); i += 2) {
      auto character = static_cast<std::uint32_t>(bigEndian(units.substr(i, 2)));
      if (character >= 0xD800 && character < 0xE000) {
        i += 2;
        const std::uint64_t low = i < units.size() ? bigEndian(units.substr(i, 2)) : 0;
        if (character >= 0xDC00 || low < 0xDC00 || low >= 0xE000) {
          fail(fmt::format("byte {}: not UTF-16", object.at));
          return {};
        }
        character = 0x10000 + ((character - 0xD800) << 10) + static_cast<std::uint32_t>(low - 0xDC00);
      }
      appendUTF8(text, character);
    }
    return text;
  }

  std::uint64_t reference(std::string_view references, std::size_t number) const {
    return bigEndian(references.substr(number * referenceBytes_, referenceBytes_));
  }

  bool mayNest(int depth) {
    return depth < kMaximumJSONDepth || fail(fmt::format("nested more than {} deep", kMaximumJSONDepth));
  }

  Dictionary array(const Object& object, int depth) {
    if (!mayNest(depth)) return {};
    const std::string_view references = payload(object.at, object.size, referenceBytes_);
    Dictionary::array_t elements;
    for (std::size_t i = 0; i < object.size && !fault_; ++i) {
      Dictionary element = value(reference(references, i), depth + 1);
      if (!element.is_null()) elements.push_back(std::move(element));
    }
    return elements;
  }

  Dictionary dictionary(const Object& object, int depth) {
    if (!mayNest(depth)) return {};
    const std::string_view keys = payload(object.at, object.size, referenceBytes_);
    const std::string_view values = payload(object.at + keys.size(), object.size, referenceBytes_);
    Dictionary::object_t members;
    // The object's own insertion would look for each key again, one member after the other.
    Dictionary::object_t::Container& all = members;
    std::unordered_set<std::string> names;
    for (std::size_t i = 0; i < object.size && !fault_; ++i) {
      charge(0);
      std::string name = string(this->object(reference(keys, i)));
      if (!names.insert(name).second) fail(fmt::format("byte {}: repeated key", object.at - 1));
      Dictionary member = value(reference(values, i), depth + 1);
      if (!member.is_null()) all.emplace_back(std::move(name), std::move(member));
    }
    return members;
  }

  std::string_view bytes_;
  std::string_view objects_;  ///< all before the offset table, so that offsets stay as they are
  std::string_view offsets_;
  std::size_t offsetBytes_ = 0;
  std::size_t referenceBytes_ = 0;
  std::uint64_t root_ = 0;
  std::size_t unfolded_ = 0;
  std::optional<Error> fault_;
};

}  // namespace

Expected<Dictionary> decodePropertyList(std::string_view bytes) {
  return Reader(bytes).read();
}

}  // namespace sable::platform

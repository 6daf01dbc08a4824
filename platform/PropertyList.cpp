#include "platform/PropertyList.h"

#include <fmt/core.h>
#include <plist/plist.h>
#include <unicode/ustring.h>

#include <memory>
#include <nlohmann/json.hpp>
#include <utility>

namespace sable::platform {

namespace {

struct FreeNode {
  void operator()(void* node) const { plist_free(node); }
};
using Node = std::unique_ptr<void, FreeNode>;

tl::unexpected<Error> notEncodable(std::string reason) {
  return tl::unexpected(Error{std::string(kPropertyListErrorDomain),
                              static_cast<std::int64_t>(PropertyListErrorCode::notEncodable),
                              std::move(reason)});
}

/// libplist takes C strings, and writes what is not UTF-8 as something else.
bool isEncodable(const std::string& text) {
  if (!std::in_range<std::int32_t>(text.size()) || text.find('\0') != text.npos) return false;
  std::int32_t length = 0;
  UErrorCode status = U_ZERO_ERROR;
  u_strFromUTF8(nullptr, 0, &length, text.data(), static_cast<std::int32_t>(text.size()), &status);
  return status != U_INVALID_CHAR_FOUND;
}

Expected<Node> makeNode(const Dictionary& value, int depth);

Expected<Node> makeString(const std::string& text) {
  if (!isEncodable(text)) return notEncodable("a string holds a NUL or is not UTF-8");
  return Node(plist_new_string(text.c_str()));
}

Expected<Node> makeArray(const Dictionary& value, int depth) {
  Node array(plist_new_array());
  for (const Dictionary& element : value) {
    if (element.is_null()) continue;
    auto node = makeNode(element, depth + 1);
    if (!node) return node;
    plist_array_append_item(array.get(), node->release());
  }
  return array;
}

Expected<Node> makeDictionary(const Dictionary& value, int depth) {
  Node dictionary(plist_new_dict());
  for (const auto& [key, element] : value.items()) {
    if (element.is_null()) continue;
    if (!isEncodable(key)) return notEncodable("a key holds a NUL or is not UTF-8");
    auto node = makeNode(element, depth + 1);
    if (!node) return node;
    plist_dict_set_item(dictionary.get(), key.c_str(), node->release());
  }
  return dictionary;
}

Expected<Node> makeInteger(const Dictionary& value) {
  if (value.is_number_unsigned()) {
    const auto number = value.get<std::uint64_t>();
    // libplist writes these as negative integers.
    if (!std::in_range<std::int64_t>(number)) return Node(plist_new_real(static_cast<double>(number)));
    return Node(plist_new_uint(number));
  }
  return Node(plist_new_uint(static_cast<std::uint64_t>(value.get<std::int64_t>())));
}

Expected<Node> makeNode(const Dictionary& value, int depth) {
  if (value.is_structured() && depth >= kMaximumJSONDepth)
    return notEncodable(fmt::format("nested more than {} deep", kMaximumJSONDepth));
  if (value.is_object()) return makeDictionary(value, depth);
  if (value.is_array()) return makeArray(value, depth);
  if (value.is_string()) return makeString(value.get_ref<const std::string&>());
  if (value.is_boolean()) return Node(plist_new_bool(value.get<bool>() ? 1 : 0));
  if (value.is_number_integer()) return makeInteger(value);
  if (value.is_number_float()) return Node(plist_new_real(value.get<double>()));
  return notEncodable("null and raw bytes have no counterpart");
}

}  // namespace

Expected<std::string> encodePropertyList(const Dictionary& value) {
  auto root = makeNode(value, 0);
  if (!root) return tl::unexpected(std::move(root.error()));
  char* bytes = nullptr;  // plist_to_bin does nothing, silently, unless this is null
  std::uint32_t length = 0;
  plist_to_bin(root->get(), &bytes, &length);
  if (bytes == nullptr) return notEncodable("libplist could not write it");
  std::string result(bytes, length);
  plist_to_bin_free(bytes);
  return result;
}

}  // namespace sable::platform

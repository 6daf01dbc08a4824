#include "sabled/SearchResponse.h"

#include <simdjson.h>

#include "platform/Dictionary.h"

namespace sable {
namespace {

using simdjson::dom::element;
using simdjson::dom::element_type;
using simdjson::dom::object;

constexpr int kMaximumImageDepth = 64;

std::optional<std::string> string(const object& parent, std::string_view key) {
  std::string_view text;
  if (parent[key].get(text) != simdjson::SUCCESS) return std::nullopt;
  return std::string(text);
}

double number(const object& parent, std::string_view key) {
  double value = 0;
  return parent[key].get(value) == simdjson::SUCCESS ? value : 0;
}

void addImage(const element& description, std::vector<SBLImageDescription>& images) {
  object members;
  if (description.get(members) != simdjson::SUCCESS) return;
  SBLImageDescription image{string(members, "url"), string(members, "id")};
  if (image.url || image.id) images.push_back(std::move(image));
}

void collectImages(const element& value, int depth, std::vector<SBLImageDescription>& images) {
  if (depth > kMaximumImageDepth) return;
  if (value.type() == element_type::ARRAY) {
    for (const element item : value.get_array()) collectImages(item, depth + 1, images);
  } else if (value.type() == element_type::OBJECT) {
    for (const auto [key, member] : value.get_object()) {
      if (key == "image") {
        addImage(member, images);
      } else if (key == "images" && member.type() == element_type::ARRAY) {
        for (const element item : member.get_array()) addImage(item, images);
      } else {
        collectImages(member, depth + 1, images);
      }
    }
  }
}

SearchResponse::ResultSet readResultSet(const object& members) {
  return {string(members, "query").value_or(""), number(members, "completion_score"),
          number(members, "max_age"), string(members, "status").value_or("")};
}

void addToAccount(const object& members, SableAnswer& account) {
  if (!account.status) account.status = string(members, "status");
  if (!account.fbq) account.fbq = string(members, "fbq");
  if (!account.partialClientIP) account.partialClientIP = string(members, "partial_client_ip");
  if (account.duration == 0) account.duration = number(members, "duration");
}

}  // namespace

Expected<SearchResponse> SearchResponse::parse(const std::string& text) {
  simdjson::dom::parser parser;
  element root;
  auto failure = parser.allocate(std::max<std::size_t>(text.size(), 64), kMaximumJSONDepth);
  if (failure == simdjson::SUCCESS) failure = parser.parse(text).get(root);
  if (failure != simdjson::SUCCESS) {
    return tl::unexpected(Error{std::string(kJSONErrorDomain),
                                static_cast<std::int64_t>(JSONErrorCode::malformed),
                                simdjson::error_message(failure)});
  }
  SearchResponse response;
  response.isObject = root.type() == element_type::OBJECT;
  object members;
  if (root.get(members) == simdjson::SUCCESS) addToAccount(members, response.account);
  if (root.type() == element_type::ARRAY) {
    for (const element item : root.get_array()) {
      if (item.get(members) != simdjson::SUCCESS) continue;
      response.resultSets.push_back(readResultSet(members));
      addToAccount(members, response.account);
    }
  }
  collectImages(root, 0, response.images);
  return response;
}

}  // namespace sable

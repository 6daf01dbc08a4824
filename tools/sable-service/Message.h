#pragma once

#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace service {

using Json = nlohmann::ordered_json;
using Pairs = std::vector<std::pair<std::string, std::string>>;

/// A request as it came over the wire. Names and values of `items` are percent-decoded (RFC 3986: a '+' stays
/// a
/// '+'), in wire order; `headers` are in arrival order with the names as they were spelled.
struct Request {
  std::string method;
  std::string target;
  std::string path;
  std::string query;
  Pairs items;
  Pairs headers;
  std::string body;

  /// The first item or header of that name; header names match in any letter case.
  std::optional<std::string> item(std::string_view name) const;
  std::optional<std::string> header(std::string_view name) const;
};

/// What goes back, and what the record of the request says beyond the ordinary.
struct Answer {
  int status = 200;
  std::string type = "application/json";
  std::string body;
  size_t zeros = 0;  ///< bytes of 0 that follow the body, made while they are sent
  Pairs headers;
  Json record = Json::object();

  static Answer json(const Json& document, int status = 200);
  static Answer empty(int status);
  static Answer error(int status, const std::string& reason);
  /// With an entity tag made from the body; 304 without the body when the request names that tag (RFC
  /// 9110, 13.1.2).
  static Answer tagged(const Request& request, std::string type, std::string body,
                       const std::string& cacheControl);
};

/// Splits a request target into path, query and items. A target in absolute form, as a proxy gets it (RFC
/// 9112, 3.2.2), loses its scheme and authority.
void readTarget(Request& request);

std::string percentDecode(std::string_view text);
std::string percentEncode(std::string_view text);

/// Serialised with anything that is not UTF-8 replaced: what a client typed comes back in answers and
/// records.
std::string toText(const Json& document);

bool equalsIgnoringCase(std::string_view a, std::string_view b);
std::string lowercase(std::string_view text);

}  // namespace service

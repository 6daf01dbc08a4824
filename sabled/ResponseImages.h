#pragma once

#include <functional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "SableKit/SBLImageDescription.h"
#include "platform/URL.h"

/// The images that answers of the service name and clients ask for.
namespace sable {

class SBLBag;
struct SearchResponse;

/// Calls back with each image of an answer: with its URL, and with the one that the bag has for its
/// identifier. What is no URL is passed over.
void enumerateImagesInResponse(const SearchResponse& response, const SBLBag& bag,
                               const std::function<void(const platform::URL&)>& callback);

/// The URLs of images in the order of their descriptions. A description with both is in both lists:
/// its identifier's image stands in where its URL's does not come.
struct OrderedImages {
  std::vector<std::string> byURL;         ///< as the client wrote them
  std::vector<std::string> byIdentifier;  ///< what the bag has; identifiers it lacks are passed over
};
OrderedImages collectOrderedImages(const std::vector<SBLImageDescription>& descriptions, const SBLBag& bag);

/// The host that a request to this URL goes to, in the one form in which hosts of images are
/// compared: lower case, an address as libcurl writes it, no dot at the end. Neither port nor user
/// belongs to it.
std::string imageHost(const platform::URL& url);

/// Whether images may have the scheme of this URL: http and https.
bool hasImageScheme(std::string_view url);

/// Whether a URL has such a scheme and one of these hosts; tells of one that has not.
bool mayLoadImage(const std::string& url, const std::set<std::string>& hosts);

}  // namespace sable

#include "sabled/ResponseImages.h"

#include "SableKit/SBLBag.h"
#include "sabled/ClientNames.h"
#include "sabled/SableLogging.h"
#include "sabled/SearchResponse.h"

namespace sable {

void enumerateImagesInResponse(const SearchResponse& response, const SBLBag& bag,
                               const std::function<void(const platform::URL&)>& callback) {
  const OrderedImages images = collectOrderedImages(response.images, bag);
  for (const auto* urls : {&images.byURL, &images.byIdentifier}) {
    for (const std::string& text : *urls) {
      if (const auto url = platform::URL::parse(text)) callback(*url);
    }
  }
}

OrderedImages collectOrderedImages(const std::vector<SBLImageDescription>& descriptions, const SBLBag& bag) {
  OrderedImages images;
  for (const SBLImageDescription& description : descriptions) {
    if (description.url) images.byURL.push_back(*description.url);
    auto url = description.id ? bag.urlForIdentifier(*description.id) : std::nullopt;
    if (url) images.byIdentifier.push_back(std::move(*url));
  }
  return images;
}

std::string imageHost(const platform::URL& url) {
  std::string host = url.host();
  if (host.ends_with('.')) host.pop_back();
  return host;
}

bool hasImageScheme(std::string_view url) {
  const std::string scheme = lowercasedASCII(url.substr(0, url.find(':')));
  return scheme == "http" || scheme == "https";
}

bool mayLoadImage(const std::string& url, const std::set<std::string>& hosts) {
  const auto& log = SableLogForCategory(SableLoggingCategoryImages);
  if (!hasImageScheme(url)) {
    log.fault("loadImage with invalid scheme: {}", url);
    return false;
  }
  // Some take a backslash for a slash, so it would leave open which host a URL names.
  const auto parsed = url.find('\\') == std::string::npos ? platform::URL::parse(url) : std::nullopt;
  if (parsed && hosts.contains(imageHost(*parsed))) return true;
  log.fault("loadImage with invalid host: {}", url);
  return false;
}

}  // namespace sable

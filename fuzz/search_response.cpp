#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>

#include "sabled/SearchResponse.h"

// Whatever a service answers is read without harm, and an image description that is reported can
// be used.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const auto response = sable::SearchResponse::parse(std::string(reinterpret_cast<const char*>(data), size));
  if (!response) return response.error().reason.empty() ? std::abort(), 0 : 0;
  if (response->isObject && !response->resultSets.empty()) std::abort();
  for (const auto& image : response->images) {
    if (!image.url && !image.id) std::abort();
  }
  return 0;
}

#include "sabled/ImageLoad.h"

#include <utility>

#include "SableKit/SBLBag.h"
#include "sabled/Assembly.h"
#include "sabled/ImageFetcher.h"
#include "sabled/ResponseImages.h"
#include "sabled/SableLogging.h"

namespace sable {
namespace {

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategoryImages);
}

/// Makes room for a name and an image among `taken` bytes of a reply; tells when there is none.
bool takeRoom(std::size_t& taken, const std::string& name, const Data& image) {
  const std::size_t bytes = name.size() + image->size();
  if (bytes > ImageLoad::kMaximumReplyBytes - taken) {
    log().error("image {} of {} bytes is left out: the reply is full", name, image->size());
    return false;
  }
  taken += bytes;
  return true;
}

}  // namespace

ImageLoad::ImageLoad(Assembly& assembly, std::shared_ptr<const SBLBag> bag)
    : assembly_(assembly),
      bag_(std::move(bag)),
      queue_(assembly.runtime.serialQueue("com.kestrel.sabled.imageLoad")),
      fetches_(assembly.runtime.waitGroup()) {}

void ImageLoad::start(const Descriptions& descriptions, const std::set<std::string>& hosts) {
  const OrderedImages images = collectOrderedImages(descriptions, *bag_);
  const auto started = assembly_.runtime.waitGroup();
  platform::Queue& workers = assembly_.runtime.globalQueue(platform::QualityOfService::high);
  std::set<std::string_view> seen;
  for (const auto* urls : {&images.byURL, &images.byIdentifier}) {
    for (const std::string& url : *urls) {
      if (url.size() > kMaximumURLBytes || !seen.insert(url).second) continue;
      started->enter();
      workers.async([&] {
        if (mayLoadImage(url, hosts)) fetch(url);
        started->leave();
      });
    }
  }
  // Not the caller's wait for images: what is in memory is to be there also for one who never waits.
  static_cast<void>(started->wait(platform::MonotonicTime::max()));
}

void ImageLoad::fetch(const std::string& url) {
  fetches_->enter();
  assembly_.imageFetcher->fetchImageData(url, bag_->timeoutIntervalForRequest(),
                                         [self = shared_from_this(), url](Expected<Data> image) {
                                           if (image) self->arrived(url, std::move(*image));
                                           self->fetches_->leave();
                                         });
}

void ImageLoad::arrived(const std::string& url, Data image) {
  queue_->sync([&] {
    if (!closed_ && takeRoom(arrivedBytes_, url, image)) arrived_.emplace(url, std::move(image));
  });
}

void ImageLoad::wait(platform::MonotonicTime deadline) {
  static_cast<void>(fetches_->wait(deadline));
}

std::map<std::string, Data> ImageLoad::images(const Descriptions& descriptions) {
  const auto come = queue_->sync([this] {
    closed_ = true;
    return std::exchange(arrived_, {});
  });
  const auto find = [&](const std::optional<std::string>& url) {
    const auto found = url ? come.find(*url) : come.end();
    return found == come.end() ? nullptr : found->second;
  };
  std::map<std::string, Data> images;
  std::size_t bytes = 0;
  const auto map = [&](const char* line, const std::string& name, const Data& image) {
    if (images.contains(name) || !takeRoom(bytes, name, image)) return;
    images.emplace(name, image);
    log().standard(fmt::runtime(line), name, image->size());
  };
  for (const auto& [url, id] : descriptions) {
    if (const Data image = find(url)) {
      map("mapping image url {} to {} bytes of data", *url, image);
    } else if (const Data shared = find(id ? bag_->urlForIdentifier(*id) : std::nullopt)) {
      map("mapping image id {} to {} bytes of data", *id, shared);
    }
  }
  return images;
}

}  // namespace sable

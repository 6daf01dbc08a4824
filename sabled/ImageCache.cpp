#include "sabled/ImageCache.h"

#include <utility>

namespace sable {

Data ImageCache::find(const std::string& url, platform::MonotonicTime now) {
  const auto found = byURL_.find(url);
  if (found == byURL_.end()) return nullptr;
  const auto image = found->second;
  if (now - image->arrival >= kMaximumAge) {
    remove(image);
    return nullptr;
  }
  images_.splice(images_.begin(), images_, image);
  return image->data;
}

void ImageCache::add(const std::string& url, Data image, platform::MonotonicTime now) {
  if (const auto found = byURL_.find(url); found != byURL_.end()) remove(found->second);
  if (image->size() > kMaximumImageBytes) return;
  bytes_ += url.size() + image->size();
  images_.push_front({url, std::move(image), now});
  byURL_.emplace(images_.front().url, images_.begin());
  while (bytes_ > kMaximumBytes || images_.size() > kMaximumImages) remove(std::prev(images_.end()));
}

void ImageCache::clear() {
  byURL_.clear();
  images_.clear();
  bytes_ = 0;
}

void ImageCache::remove(Images::iterator image) {
  bytes_ -= image->url.size() + image->data->size();
  byURL_.erase(image->url);
  images_.erase(image);
}

}  // namespace sable

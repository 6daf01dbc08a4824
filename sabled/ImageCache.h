#pragma once

#include <cstddef>
#include <list>
#include <string>
#include <string_view>
#include <unordered_map>

#include "platform/Data.h"
#include "platform/Runtime.h"

namespace sable {

/// Images in memory, by URL; those that were not asked for the longest make room for new ones. Has
/// no lock of its own.
class ImageCache {
 public:
  static constexpr std::size_t kMaximumBytes = 8u << 20;  ///< of images and their URLs
  static constexpr std::size_t kMaximumImages = 512;
  /// A larger one would drive too many others out.
  static constexpr std::size_t kMaximumImageBytes = 1u << 20;
  /// Then the service is asked again, for images do change.
  static constexpr platform::Duration kMaximumAge = std::chrono::hours(1);

  /// Null where there is none, or one that is too old.
  Data find(const std::string& url, platform::MonotonicTime now);
  void add(const std::string& url, Data image, platform::MonotonicTime now);
  void clear();
  bool empty() const { return images_.empty(); }

 private:
  struct Image {
    std::string url;
    Data data;
    platform::MonotonicTime arrival;
  };
  using Images = std::list<Image>;

  void remove(Images::iterator image);

  Images images_;  // the last used first
  std::unordered_map<std::string_view, Images::iterator> byURL_;
  std::size_t bytes_ = 0;
};

}  // namespace sable

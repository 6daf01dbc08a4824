#include <gtest/gtest.h>

#include "sabled/ImageCache.h"

namespace sable {
namespace {

using namespace std::chrono_literals;

TEST(ImageCache, TheLeastUsedMakeRoomForNewOnes) {
  ImageCache cache;
  const platform::MonotonicTime now(1h);
  const Data large = makeData(std::string(ImageCache::kMaximumImageBytes, 'x'));
  for (int i = 0; i < 7; ++i) cache.add(std::to_string(i), large, now);
  cache.find("0", now);
  cache.add("7", large, now);  // eight of them and their names are too much
  EXPECT_EQ(cache.find("1", now), nullptr);
  for (const char* url : {"0", "2", "7"}) EXPECT_NE(cache.find(url, now), nullptr) << url;
  cache.add("8", makeData(*large + "x"), now);
  EXPECT_EQ(cache.find("8", now), nullptr) << "too large for so small a memory";

  for (std::size_t i = 0; i <= ImageCache::kMaximumImages; ++i) {
    cache.add("small" + std::to_string(i), makeData("x"), now);
  }
  EXPECT_EQ(cache.find("small0", now), nullptr);
  EXPECT_NE(cache.find("small1", now), nullptr);
  EXPECT_EQ(cache.find("small1", now + ImageCache::kMaximumAge), nullptr);
  cache.clear();
  EXPECT_TRUE(cache.empty());
}

}  // namespace
}  // namespace sable

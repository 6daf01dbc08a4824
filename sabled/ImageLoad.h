#pragma once

#include <cstddef>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "SableKit/SBLImageDescription.h"
#include "platform/Data.h"
#include "platform/Runtime.h"

namespace sable {

class Assembly;
class SBLBag;

/// What one call asks for: starts its fetches, waits, and gathers what has come by then. Fetches
/// that end later find nobody waiting. Any thread.
class ImageLoad : public std::enable_shared_from_this<ImageLoad> {
 public:
  /// Of all names and images together: client libraries take messages of up to 16 MiB.
  static constexpr std::size_t kMaximumReplyBytes = 15u << 20;
  /// Longer URLs are not looked at.
  static constexpr std::size_t kMaximumURLBytes = 8192;

  using Descriptions = std::vector<SBLImageDescription>;

  ImageLoad(Assembly& assembly, std::shared_ptr<const SBLBag> bag);

  /// Starts to fetch what may be loaded from `hosts`, each URL once. On return, what the fetcher
  /// had in memory is there.
  void start(const Descriptions& descriptions, const std::set<std::string>& hosts);
  /// Blocks until every fetch has ended, at most until `deadline`.
  void wait(platform::MonotonicTime deadline);
  /// What has come, by URL as described, else by identifier. Once: it takes nothing in afterwards.
  std::map<std::string, Data> images(const Descriptions& descriptions);

 private:
  void fetch(const std::string& url);
  void arrived(const std::string& url, Data image);

  Assembly& assembly_;
  const std::shared_ptr<const SBLBag> bag_;
  const std::shared_ptr<platform::SerialQueue> queue_;
  const std::unique_ptr<platform::WaitGroup> fetches_;

  // On queue_.
  std::map<std::string, Data> arrived_;  ///< by URL
  std::size_t arrivedBytes_ = 0;
  bool closed_ = false;
};

}  // namespace sable

#pragma once

#include <list>
#include <memory>
#include <string>
#include <unordered_map>

#include "platform/HTTPSession.h"
#include "platform/MemoryPressure.h"
#include "platform/Runtime.h"
#include "sabled/ImageCache.h"

namespace sable {

class Assembly;

/// Fetches images over the session of searches. An image is what a 200 brings, whatever its type is
/// called: the daemon never looks into it. Any thread.
///
/// A fetch's life, on the fetcher's queue:
///
///     waiting --a place is free--> running --200--> cached, answered
///        |                          |   ^ '-- any other end --> failed
///        '------ time-out --------> |   '-- redirect to a host that was vouched for
///                                failed
class ImageFetcher {
 public:
  static constexpr std::size_t kMaximumImageBytes = 4u << 20;  ///< of one image; a larger one is cut off
  static constexpr std::size_t kMaximumRunning = 32;           ///< transfers at one time
  static constexpr std::size_t kMaximumRunningPerHost = 16;
  static constexpr std::size_t kMaximumReplies = 8192;  ///< owed at one time; one more fails at once
  static constexpr int kMaximumRedirects = 5;
  static constexpr double kMaximumTimeout = 300;  ///< seconds, whatever is asked for

  explicit ImageFetcher(Assembly& assembly);
  ~ImageFetcher();

  using Reply = platform::Function<void(Expected<Data>)>;

  /// Delivers the bytes behind a URL of scheme http or https: never null, never empty, from memory
  /// where they are there. Who asks while the URL is under way shares the transfer, and its time.
  /// `timeout`: seconds for all of it, waiting and redirects included. `reply` is called once,
  /// within the call for what is in memory or refused, otherwise on a queue of the fetcher's; it
  /// must not block or call the fetcher. The URL's own host is the caller's to judge; a redirect is
  /// followed only to hosts that answers of the service have vouched for.
  void fetchImageData(const std::string& url, double timeout, Reply reply);

 private:
  struct Fetch;
  using FetchPointer = std::shared_ptr<Fetch>;

  void enqueue(const std::string& url, const std::string& host, double timeout, Reply reply);
  void startWaiting();
  void start(const FetchPointer& fetch);
  void enableProxy(platform::HTTPDataTask& task);
  void finished(const FetchPointer& fetch, const platform::HTTPResult& result);
  void redirect(const FetchPointer& fetch, const std::string& location);
  void keep(const Fetch& fetch, const platform::HTTPResult& result);
  void end(const FetchPointer& fetch, const Expected<Data>& outcome);

  Assembly& assembly_;
  const std::shared_ptr<platform::SerialQueue> queue_;

  // On queue_.
  ImageCache cache_;
  std::unique_ptr<platform::MemoryPressure::Source> memoryPressure_;  ///< while there is something to drop
  std::unordered_map<std::string, FetchPointer> fetches_;             ///< by URL
  std::list<FetchPointer> waiting_;
  std::size_t repliesOwed_ = 0;
  std::size_t running_ = 0;
  std::unordered_map<std::string, std::size_t> runningByHost_;
  bool proxyFailed_ = false;  ///< told of once, until it works again
};

}  // namespace sable

#include "sabled/ImageFetcher.h"

#include <algorithm>
#include <array>
#include <utility>
#include <vector>

#include "SableKit/SBLError.h"
#include "platform/NetworkServiceProxy.h"
#include "platform/URL.h"
#include "sabled/Assembly.h"
#include "sabled/ClientNames.h"
#include "sabled/ClientStateManager.h"
#include "sabled/ResponseImages.h"
#include "sabled/SableLogging.h"

namespace sable {
namespace {

using platform::httpError;
using platform::HTTPErrorCode;
using platform::HTTPResult;
using platform::URL;

constexpr double kMinimumTimeout = 0.001;

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategoryImages);
}

bool isRedirect(int status) {
  static constexpr std::array kStatuses{301, 302, 303, 307, 308};  // RFC 9110 section 15.4
  return std::ranges::find(kStatuses, status) != kStatuses.end();
}

bool mayBeStored(const platform::HTTPResponse& response) {
  const std::string* control = response.headers.find("Cache-Control");
  return control == nullptr || lowercasedASCII(*control).find("no-store") == std::string::npos;
}

/// Why a completed transfer brought no image.
std::optional<Error> objection(const HTTPResult& result) {
  if (result.error) return result.error;
  if (result.response->status != 200) {
    return makeSBLError(SBLErrorCode::network, "statusCode " + std::to_string(result.response->status));
  }
  if (result.data == nullptr || result.data->empty()) return makeSBLError(SBLErrorCode::network, "no data");
  return std::nullopt;
}

}  // namespace

struct ImageFetcher::Fetch {
  Fetch(std::string url, std::string itsHost, double seconds)
      : asked(std::move(url)), host(std::move(itsHost)), timeout(seconds), current(asked) {}

  const std::string asked;
  const std::string host;  ///< of `asked`; its transfers take a place there
  const double timeout;    ///< seconds
  std::vector<Reply> replies;
  std::string current;  ///< after redirects
  int redirects = 0;
  std::list<FetchPointer>::iterator place;  ///< in waiting_, until it runs
  bool running = false;
  bool ended = false;
  std::shared_ptr<platform::HTTPDataTask> task;
  platform::Timer deadline;
};

ImageFetcher::ImageFetcher(Assembly& assembly)
    : assembly_(assembly), queue_(assembly.runtime.serialQueue("com.kestrel.sabled.imageFetcher")) {}

ImageFetcher::~ImageFetcher() = default;

void ImageFetcher::fetchImageData(const std::string& url, double timeout, Reply reply) {
  const auto parsed = URL::parse(url);
  if (!hasImageScheme(url)) {
    const std::string reason = "invalid url scheme: " + url;
    log().error("{}", reason);
    return reply(tl::unexpected(makeSBLError(SBLErrorCode::daemonSide, reason)));
  }
  if (!parsed) return reply(tl::unexpected(httpError(HTTPErrorCode::badURL, url + " is no URL")));
  const Data cached = queue_->sync([&] {
    Data image = cache_.find(url, assembly_.runtime.ticks());
    if (image == nullptr) enqueue(url, imageHost(*parsed), timeout, std::move(reply));
    if (cache_.empty()) memoryPressure_ = nullptr;
    return image;
  });
  if (cached != nullptr) reply(cached);
}

void ImageFetcher::enqueue(const std::string& url, const std::string& host, double timeout, Reply reply) {
  if (repliesOwed_ == kMaximumReplies) {
    return reply(tl::unexpected(makeSBLError(SBLErrorCode::daemonSide, "too many images under way")));
  }
  ++repliesOwed_;
  FetchPointer& fetch = fetches_[url];
  if (fetch != nullptr) return fetch->replies.push_back(std::move(reply));
  timeout = timeout >= kMinimumTimeout ? std::min(timeout, kMaximumTimeout) : kMinimumTimeout;
  fetch = std::make_shared<Fetch>(url, host, timeout);
  fetch->replies.push_back(std::move(reply));
  fetch->deadline = queue_->after(platform::fromSeconds(timeout), [this, weak = std::weak_ptr(fetch)] {
    if (const auto late = weak.lock())
      end(late, tl::unexpected(httpError(HTTPErrorCode::timedOut, "no image in time")));
  });
  fetch->place = waiting_.insert(waiting_.end(), fetch);
  startWaiting();
}

void ImageFetcher::startWaiting() {
  for (auto next = waiting_.begin(); next != waiting_.end() && running_ < kMaximumRunning;) {
    const FetchPointer fetch = *next;
    std::size_t& ofHost = runningByHost_[fetch->host];
    if (ofHost >= kMaximumRunningPerHost) {
      ++next;
      continue;
    }
    next = waiting_.erase(next);
    ++ofHost;
    ++running_;
    fetch->running = true;
    start(fetch);
  }
}

void ImageFetcher::start(const FetchPointer& fetch) {
  platform::HTTPRequest request;
  request.url = fetch->current;
  request.timeout = fetch->timeout;
  request.followsRedirects = false;
  request.maximumResponseBytes = kMaximumImageBytes;
  // Weakly, for the fetch holds its task.
  const auto completed = [this, weak = std::weak_ptr(fetch)](HTTPResult result) {
    queue_->async([this, weak, result = std::move(result)] {
      if (const auto alive = weak.lock()) finished(alive, result);
    });
  };
  fetch->task = assembly_.urlSession().dataTask(std::move(request), completed);
  if (assembly_.useBramble()) enableProxy(*fetch->task);
  fetch->task->resume();
}

void ImageFetcher::enableProxy(platform::HTTPDataTask& task) {
  const bool failed = !assembly_.platform.networkServiceProxy().enable(task);
  if (failed && !proxyFailed_) log().error("Enabling Bramble for #image request failed.");
  proxyFailed_ = failed;
}

void ImageFetcher::finished(const FetchPointer& fetch, const HTTPResult& result) {
  if (fetch->ended) return;
  if (!result.error && isRedirect(result.response->status)) {
    if (const std::string* location = result.response->headers.find("Location")) {
      return redirect(fetch, *location);
    }
  }
  if (auto error = objection(result)) return end(fetch, tl::unexpected(std::move(*error)));
  keep(*fetch, result);
  end(fetch, result.data);
}

void ImageFetcher::redirect(const FetchPointer& fetch, const std::string& location) {
  const auto refuse = [&](HTTPErrorCode code, const char* reason) {
    end(fetch, tl::unexpected(httpError(code, reason)));
  };
  if (++fetch->redirects > kMaximumRedirects)
    return refuse(HTTPErrorCode::tooManyRedirects, "too many redirects");
  const auto target = URL::parse(fetch->current)->resolve(location);
  const std::string& next = target ? target->string() : location;
  if (!mayLoadImage(next, assembly_.clientStateManager->validImageHosts())) {
    return refuse(HTTPErrorCode::notAllowed, "redirected to where no image may come from");
  }
  fetch->current = next;
  start(fetch);
}

void ImageFetcher::keep(const Fetch& fetch, const HTTPResult& result) {
  if (!mayBeStored(*result.response)) return;
  cache_.add(fetch.asked, result.data, assembly_.runtime.ticks());
  if (cache_.empty() || memoryPressure_ != nullptr) return;
  memoryPressure_ = assembly_.platform.memoryPressure().onCritical(queue_, [this] {
    cache_.clear();
    memoryPressure_ = nullptr;
  });
}

void ImageFetcher::end(const FetchPointer& fetch, const Expected<Data>& outcome) {
  fetch->ended = true;
  fetch->deadline.cancel();
  fetches_.erase(fetch->asked);
  if (fetch->running) {
    --running_;
    const auto ofHost = runningByHost_.find(fetch->host);
    if (--ofHost->second == 0) runningByHost_.erase(ofHost);
  } else {
    waiting_.erase(fetch->place);
  }
  if (const auto task = std::exchange(fetch->task, nullptr)) task->cancel();
  if (!outcome) log().info("no image from {}: {}", fetch->asked, outcome.error().description());
  repliesOwed_ -= fetch->replies.size();
  for (Reply& reply : std::exchange(fetch->replies, {})) reply(outcome);
  if (fetch->running) startWaiting();
}

}  // namespace sable

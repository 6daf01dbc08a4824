#include "platform/simulated/SimulatedHTTP.h"

#include <algorithm>

#include "platform/NotificationCenter.h"
#include "platform/simulated/SimulatedTransfers.h"

namespace sable::platform::simulated {
namespace {

std::string pathOf(const std::string& url) {
  const auto authority = url.find("://");
  if (authority == std::string::npos) return {};
  const auto start = std::min(url.find_first_of("/?#", authority + 3), url.size());
  const auto end = std::min(url.find_first_of("?#", start), url.size());
  return end == start ? "/" : url.substr(start, end - start);
}

/// What the tasks of a session share; lives as long as the last of them.
struct Shared {
  Runtime& runtime;
  ScriptedService& service;
  const HTTPSessionConfiguration configuration;
  const std::shared_ptr<SerialQueue> queue;
};

class SimulatedTask final : public HTTPDataTask, public std::enable_shared_from_this<SimulatedTask> {
 public:
  SimulatedTask(std::shared_ptr<Shared> shared, HTTPRequest request, HTTPSession::Completion completion)
      : shared_(std::move(shared)), request_(std::move(request)), completion_(std::move(completion)) {}

  void resume() override {
    if (std::exchange(resumed_, true)) return;
    start_ = shared_->runtime.now();
    if (auto error = invalidity(request_)) return end(Duration{}, std::move(error));
    if (!proxyURL_.empty() && !isProxyURL(proxyURL_)) {
      return end(Duration{}, httpError(HTTPErrorCode::proxyFailed, "not a URL of a proxy"));
    }
    answer_ = shared_->service.answer(
        {request_, pathOf(request_.url), shared_->configuration.label, proxyURL_, shared_->runtime.ticks()});
    const auto timeout = fromSeconds(request_.timeout);
    if (*answer_.latency >= timeout) {
      return end(timeout, httpError(HTTPErrorCode::timedOut, "no progress in time"));
    }
    if (answer_.error) return end(*answer_.latency, httpError(*answer_.error, "scripted"));
    end(*answer_.latency, std::nullopt);
  }

  void cancel() override {
    if (!std::exchange(resumed_, true)) start_ = shared_->runtime.now();
    end(Duration{}, httpError(HTTPErrorCode::cancelled, "cancelled"));
  }

  void setProxy(std::string proxyURL) override { proxyURL_ = std::move(proxyURL); }

 private:
  void end(Duration after, std::optional<Error> error) {
    // Of several ends that are on their way, the one that was asked for last counts.
    auto timer = shared_->queue->after(
        after, [self = shared_from_this(), end = ++ends_, after, error = std::move(error)]() mutable {
          if (end == self->ends_) self->complete(after, std::move(error));
        });
    timer.detach();
  }

  void complete(Duration total, std::optional<Error> error) {
    HTTPSession::Completion completion = std::move(completion_);
    if (!completion) return;
    HTTPResult result;
    result.error = std::move(error);
    result.timing.start = start_;
    result.timing.total = total;
    result.timing.proxied = !proxyURL_.empty();
    if (!result.error) deliver(result);
    completion(std::move(result));
  }

  void deliver(HTTPResult& result) {
    const std::size_t limit =
        std::min(shared_->configuration.maximumResponseBytes, request_.maximumResponseBytes);
    const std::size_t size = answer_.body.size();
    result.timing.responseStart = result.timing.total;
    result.timing.responseBodyBytes = static_cast<std::int64_t>(std::min(size, limit));
    result.timing.requestBodyBytes = request_.body ? static_cast<std::int64_t>(request_.body->size()) : 0;
    result.timing.protocol = "http/1.1";
    result.response = HTTPResponse{answer_.url.empty() ? request_.url : answer_.url, answer_.status,
                                   answer_.headers, false};
    result.data = makeData(answer_.body.substr(0, limit));
    if (size > limit) {
      result.error = httpError(HTTPErrorCode::responseTooLarge, "body is larger than allowed");
    }
  }

  const std::shared_ptr<Shared> shared_;
  const HTTPRequest request_;
  HTTPSession::Completion completion_;
  std::string proxyURL_;
  bool resumed_ = false;
  WallTime start_{};
  Scripted answer_;
  int ends_ = 0;
};

class SimulatedHTTPSession final : public HTTPSession {
 public:
  explicit SimulatedHTTPSession(Shared shared) : shared_(std::make_shared<Shared>(std::move(shared))) {}

  std::shared_ptr<HTTPDataTask> dataTask(HTTPRequest request, Completion completion) override {
    return std::make_shared<SimulatedTask>(shared_, std::move(request), std::move(completion));
  }
  SerialQueue& callbackQueue() override { return *shared_->queue; }
  bool hasCache() const override { return shared_->configuration.allowsCache; }
  void purgeMemoryCache() override { shared_->service.noteMemoryPurge(); }

 private:
  const std::shared_ptr<Shared> shared_;
};

}  // namespace

std::vector<RecordedRequest> ScriptedService::requests(std::string_view pathPrefix) const {
  std::vector<RecordedRequest> result;
  std::copy_if(requests_.begin(), requests_.end(), std::back_inserter(result),
               [&](const RecordedRequest& each) { return each.path.starts_with(pathPrefix); });
  return result;
}

Scripted ScriptedService::answer(RecordedRequest request) {
  requests_.push_back(std::move(request));
  // A handler may look at what was asked, or send requests itself.
  const RecordedRequest asked = requests_.back();
  Scripted answer;
  if (!faults_.empty()) {
    answer.error = faults_.front();
    faults_.erase(faults_.begin());
  } else {
    const Handler* handler = nullptr;
    // In order of prefix, so that the last one that fits is the longest.
    for (const auto& [prefix, each] : handlers_) {
      if (asked.path.starts_with(prefix)) handler = &each;
    }
    if (handler == nullptr) {
      answer.status = 404;
    } else {
      answer = (*handler)(asked.request);
    }
  }
  if (!answer.latency) answer.latency = defaultLatency_;
  return answer;
}

SimulatedHTTPSessions::SimulatedHTTPSessions(Runtime& runtime, NotificationCenter& center, FileManager& files)
    : runtime_(runtime), center_(center), files_(files), disk_(std::make_shared<SimulatedTransferDisk>()) {}

SimulatedHTTPSessions::~SimulatedHTTPSessions() = default;

std::unique_ptr<HTTPSession> SimulatedHTTPSessions::session(HTTPSessionConfiguration configuration) {
  auto queue = runtime_.serialQueue(configuration.label);
  return std::make_unique<SimulatedHTTPSession>(
      Shared{runtime_, service_, std::move(configuration), std::move(queue)});
}

std::unique_ptr<HTTPBackgroundSession> SimulatedHTTPSessions::backgroundSession(
    HTTPBackgroundSessionConfiguration configuration, HTTPBackgroundSessionDelegate& delegate) {
  HTTPSessionConfiguration attempts;
  attempts.label = configuration.identifier;
  attempts.maximumResponseBytes = configuration.maximumDownloadBytes;
  auto host =
      std::make_unique<SimulatedTransferHost>(disk_, files_, session(std::move(attempts)), configuration);
  return std::make_unique<BackgroundTransfers>(runtime_, center_, std::move(host), std::move(configuration),
                                               delegate);
}

void SimulatedHTTPSessions::setConditions(const TransferConditions& conditions) {
  disk_->conditions = conditions;
  center_.post({kNetworkCostDidChangeNotification, this, {}});
}

void SimulatedHTTPSessions::failAccepting(int number) {
  disk_->failure = number;
}

std::vector<BackgroundTransfer> SimulatedHTTPSessions::pendingTransfers() const {
  return disk_->unreported("");
}

}  // namespace sable::platform::simulated

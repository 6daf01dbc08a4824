#include "platform/host/HostHTTPSession.h"

#include <algorithm>
#include <atomic>
#include <mutex>
#include <unordered_map>
#include <vector>

#include "platform/host/CurlMulti.h"
#include "platform/host/CurlTransfer.h"
#include "platform/host/HostTransferHost.h"
#include "platform/host/ResponseCache.h"

namespace sable::platform::host {
namespace {

constexpr std::size_t kSpareHandles = 4;

struct CurlShareDeleter {
  void operator()(CURLSH* share) const { curl_share_cleanup(share); }
};

void initializeLibcurl() {
  static std::once_flag once;
  std::call_once(once, [] { curl_global_init(CURL_GLOBAL_DEFAULT); });
}

}  // namespace

class HostHTTPSession::Task final : public HTTPDataTask, public std::enable_shared_from_this<Task> {
 public:
  Task(std::shared_ptr<Core> session, HTTPRequest request, std::optional<TransferFiles> files,
       Completion completion)
      : request_(std::move(request)),
        session_(std::move(session)),
        files_(std::move(files)),
        completion_(std::move(completion)) {}

  void resume() override;
  void cancel() override;
  void setProxy(std::string proxyURL) override { proxyURL_ = std::move(proxyURL); }

 private:
  friend class Core;
  enum class State { created, lookingUp, running, ended };

  const HTTPRequest request_;
  const std::shared_ptr<Core> session_;
  std::string proxyURL_;  // set before resume()
  std::atomic<bool> resumed_ = false;

  // The session's queue.
  State state_ = State::created;
  std::optional<TransferFiles> files_;
  Completion completion_;
  std::optional<CurlTransfer> transfer_;
  ResponseCache::Stored stored_;  // what the server is asked to validate
};

class HostHTTPSession::Core : public std::enable_shared_from_this<Core> {
 public:
  using TaskPointer = std::shared_ptr<Task>;

  Core(HostRuntime& runtime, HTTPSessionConfiguration configuration, std::filesystem::path cacheFile)
      : runtime_(runtime),
        configuration_(std::move(configuration)),
        queue_(std::static_pointer_cast<HostQueue>(runtime.serialQueue(configuration_.label + ".http"))),
        callbackQueue_(runtime.serialQueue(configuration_.label)) {
    if (!configuration_.allowsCache) return;
    cache_ =
        std::make_shared<ResponseCache>(runtime, queue_, std::move(cacheFile),
                                        configuration_.cacheMemoryCapacity, configuration_.cacheDiskCapacity);
  }

  HostQueue& queue() { return *queue_; }
  SerialQueue& callbackQueue() { return *callbackQueue_; }
  bool hasCache() const { return configuration_.allowsCache; }

  void start(const TaskPointer& task);
  void cancel(const TaskPointer& task);
  void purgeMemoryCache();
  void close();

 private:
  void lookUp(const TaskPointer& task);
  void found(const TaskPointer& task, ResponseCache::Stored stored);
  void transfer(const TaskPointer& task);
  CurlEasy easyHandle();
  void finished(CURL* easy, CURLcode code);
  void stop(const TaskPointer& task, Error error);
  void putBack(Task& task);
  void fail(Task& task, Error error);
  void end(Task& task, HTTPResult result);

  void throughCache(Task& task, HTTPResult& result);
  HTTPResult storedResult(const StoredResponse& stored) const;

  void callBy(MonotonicTime time);
  void lookAfterTime();
  void rest();

  HostRuntime& runtime_;
  const HTTPSessionConfiguration configuration_;
  const std::shared_ptr<HostQueue> queue_;
  const std::shared_ptr<SerialQueue> callbackQueue_;

  // The queue's.
  std::shared_ptr<ResponseCache> cache_;
  std::unique_ptr<CURLSH, CurlShareDeleter> share_;  // outlives the easy handles
  std::vector<CurlEasy> spareHandles_;
  std::unordered_map<CURL*, TaskPointer> running_;
  std::shared_ptr<CurlMulti> multi_;
  MonotonicTime lastUse_{};
  Timer timer_;
  MonotonicTime timerDue_ = MonotonicTime::max();
  bool closed_ = false;
};

void HostHTTPSession::Task::resume() {
  if (resumed_.exchange(true)) return;
  enter(session_->queue(), [self = shared_from_this()] { self->session_->start(self); });
}

void HostHTTPSession::Task::cancel() {
  session_->queue().async([self = shared_from_this()] { self->session_->cancel(self); });
}

void HostHTTPSession::Core::start(const TaskPointer& task) {
  if (task->state_ != Task::State::created) return;
  if (closed_) return fail(*task, httpError(HTTPErrorCode::cancelled, "session is closed"));
  if (task->files_ && task->files_->error) return fail(*task, *task->files_->error);
  if (auto error = invalidity(task->request_)) return fail(*task, std::move(*error));
  if (!task->proxyURL_.empty() && !isProxyURL(task->proxyURL_)) {
    return fail(*task, httpError(HTTPErrorCode::proxyFailed, "not a URL of a proxy"));
  }
  const bool asksCache = cache_ && task->request_.cachePolicy == HTTPCachePolicy::useProtocol;
  if (asksCache && isCacheable(task->request_)) return lookUp(task);
  transfer(task);
}

void HostHTTPSession::Core::lookUp(const TaskPointer& task) {
  task->state_ = Task::State::lookingUp;
  cache_->find(task->request_.url, [weak = weak_from_this(), task](ResponseCache::Stored stored) {
    if (const auto self = weak.lock()) self->found(task, std::move(stored));
  });
}

void HostHTTPSession::Core::found(const TaskPointer& task, ResponseCache::Stored stored) {
  if (task->state_ != Task::State::lookingUp) return;
  const Reuse use = stored ? reuse(*stored, task->request_, runtime_.now()) : Reuse::never;
  if (use == Reuse::asItIs) return end(*task, storedResult(*stored));
  if (use == Reuse::afterValidation) task->stored_ = std::move(stored);
  transfer(task);
}

void HostHTTPSession::Core::transfer(const TaskPointer& task) {
  task->state_ = Task::State::running;
  HTTPHeaders conditions;
  if (task->stored_) addConditions(*task->stored_, conditions);
  task->transfer_.emplace(runtime_, configuration_, task->request_, std::move(conditions), task->proxyURL_,
                          task->files_ ? &*task->files_ : nullptr);
  task->transfer_->prepare(easyHandle());
  running_.emplace(task->transfer_->easy(), task);
  callBy(task->transfer_->deadline());
  multi_->add(task->transfer_->easy());
}

CurlEasy HostHTTPSession::Core::easyHandle() {
  if (!multi_) {
    initializeLibcurl();
    multi_ = std::make_shared<CurlMulti>(runtime_.reactor(), queue_, configuration_.pipelining,
                                         [this](CURL* easy, CURLcode code) { finished(easy, code); });
  }
  if (configuration_.tlsSessionTickets && !share_) {
    share_.reset(curl_share_init());
    curl_share_setopt(share_.get(), CURLSHOPT_SHARE, CURL_LOCK_DATA_SSL_SESSION);
  }
  CurlEasy easy;
  if (spareHandles_.empty()) {
    easy.reset(curl_easy_init());
  } else {
    easy = std::move(spareHandles_.back());
    spareHandles_.pop_back();
  }
  if (share_) curl_easy_setopt(easy.get(), CURLOPT_SHARE, share_.get());
  return easy;
}

void HostHTTPSession::Core::finished(CURL* easy, CURLcode code) {
  const auto found = running_.find(easy);
  if (found == running_.end()) return;
  const TaskPointer task = std::move(found->second);
  HTTPResult result = task->transfer_->result(code);
  running_.erase(found);
  putBack(*task);
  if (cache_ && !result.error) throughCache(*task, result);
  end(*task, std::move(result));
}

void HostHTTPSession::Core::stop(const TaskPointer& task, Error error) {
  CURL* const easy = task->transfer_->easy();
  HTTPResult result = task->transfer_->result(std::move(error));
  running_.erase(easy);
  multi_->remove(easy);
  putBack(*task);
  end(*task, std::move(result));
}

void HostHTTPSession::Core::putBack(Task& task) {
  CurlEasy easy = task.transfer_->release();
  if (spareHandles_.size() < kSpareHandles) {
    curl_easy_reset(easy.get());  // lets go of what the transfer owns
    spareHandles_.push_back(std::move(easy));
  }
  if (!running_.empty()) return;
  lastUse_ = runtime_.ticks();
  callBy(lastUse_ + configuration_.idleConnectionTimeout);
}

void HostHTTPSession::Core::cancel(const TaskPointer& task) {
  if (task->state_ == Task::State::ended) return;
  Error error = httpError(HTTPErrorCode::cancelled, "cancelled");
  if (task->state_ == Task::State::running) return stop(task, std::move(error));
  fail(*task, std::move(error));
}

void HostHTTPSession::Core::fail(Task& task, Error error) {
  HTTPResult result;
  result.timing.start = runtime_.now();
  result.error = std::move(error);
  end(task, std::move(result));
}

void HostHTTPSession::Core::end(Task& task, HTTPResult result) {
  task.state_ = Task::State::ended;
  task.stored_ = nullptr;
  task.transfer_.reset();
  task.files_.reset();
  Completion completion = std::move(task.completion_);
  if (!completion) return;
  callbackQueue_->async([completion = std::move(completion), result = std::move(result)]() mutable {
    completion(std::move(result));
  });
}

void HostHTTPSession::Core::throughCache(Task& task, HTTPResult& result) {
  const HTTPRequest& request = task.request_;
  const int status = result.response->status;
  if (invalidates(request, status)) cache_->remove(request.url);
  // What a redirect led to is the answer to another URL.
  if (!isCacheable(request) || result.timing.redirects > 0) return;
  if (status == 304 && task.stored_) {
    StoredResponse fresh =
        validated(*task.stored_, result.response->headers, task.transfer_->startTime(), runtime_.now());
    HTTPResult answer = storedResult(fresh);
    result.data = std::move(answer.data);
    result.response = std::move(answer.response);
    cache_->store(std::move(fresh));
  } else if (isStorable(request, status, result.response->headers)) {
    cache_->store({request.url, status, result.response->headers,
                   variedFields(request.headers, result.response->headers), result.data,
                   task.transfer_->startTime(), runtime_.now()});
  } else if (status < 500) {
    cache_->remove(request.url);
  }
}

HTTPResult HostHTTPSession::Core::storedResult(const StoredResponse& stored) const {
  HTTPResult result;
  result.timing.start = runtime_.now();
  result.data = stored.body;
  result.response = HTTPResponse{stored.url, stored.status, stored.headers, true};
  const auto age = std::chrono::floor<std::chrono::seconds>(currentAge(stored, result.timing.start));
  result.response->headers.set("Age", std::to_string(age.count()));
  return result;
}

void HostHTTPSession::Core::purgeMemoryCache() {
  if (cache_) cache_->purgeMemory();
}

// One timer serves all: the deadlines of transfers, which move on with every byte and are looked at
// again when it fires, and the end of idle connections.
void HostHTTPSession::Core::callBy(MonotonicTime time) {
  if (time >= timerDue_) return;
  timerDue_ = time;
  timer_ = queue_->after(time - runtime_.ticks(), [weak = weak_from_this()] {
    if (const auto self = weak.lock()) self->lookAfterTime();
  });
}

void HostHTTPSession::Core::lookAfterTime() {
  timerDue_ = MonotonicTime::max();
  const MonotonicTime now = runtime_.ticks();
  MonotonicTime next = MonotonicTime::max();
  std::vector<TaskPointer> late;
  for (const auto& [easy, task] : running_) {
    if (task->transfer_->deadline() <= now) {
      late.push_back(task);
    } else {
      next = std::min(next, task->transfer_->deadline());
    }
  }
  for (const auto& task : late) stop(task, httpError(HTTPErrorCode::timedOut, "no progress in time"));
  if (running_.empty() && multi_) {
    next = lastUse_ + configuration_.idleConnectionTimeout;
    if (next <= now) return rest();
  }
  if (next != MonotonicTime::max()) callBy(next);
}

void HostHTTPSession::Core::rest() {
  multi_ = nullptr;
  spareHandles_.clear();
  if (cache_) cache_->rest();
}

void HostHTTPSession::Core::close() {
  closed_ = true;
  timer_.cancel();
  while (!running_.empty()) {
    stop(TaskPointer(running_.begin()->second), httpError(HTTPErrorCode::cancelled, "session is closed"));
  }
  rest();
  timer_.cancel();
  share_ = nullptr;
}

HostHTTPSession::HostHTTPSession(HostRuntime& runtime, HTTPSessionConfiguration configuration,
                                 std::filesystem::path cacheFile)
    : core_(std::make_shared<Core>(runtime, std::move(configuration), std::move(cacheFile))) {}

HostHTTPSession::~HostHTTPSession() {
  core_->queue().sync([this] { core_->close(); });
}

std::shared_ptr<HTTPDataTask> HostHTTPSession::dataTask(HTTPRequest request, Completion completion) {
  return std::make_shared<Task>(core_, std::move(request), std::nullopt, std::move(completion));
}

std::shared_ptr<HTTPDataTask> HostHTTPSession::fileTask(HTTPRequest request, TransferFiles files,
                                                        Completion completion) {
  return std::make_shared<Task>(core_, std::move(request), std::move(files), std::move(completion));
}

SerialQueue& HostHTTPSession::callbackQueue() {
  return core_->callbackQueue();
}

bool HostHTTPSession::hasCache() const {
  return core_->hasCache();
}

void HostHTTPSession::purgeMemoryCache() {
  core_->queue().async([core = core_] { core->purgeMemoryCache(); });
}

std::unique_ptr<HTTPSession> HostHTTPSessions::session(HTTPSessionConfiguration configuration) {
  return std::make_unique<HostHTTPSession>(runtime_, std::move(configuration),
                                           cacheFolder_ / "http" / "cache.db");
}

std::unique_ptr<HTTPBackgroundSession> HostHTTPSessions::backgroundSession(
    HTTPBackgroundSessionConfiguration configuration, HTTPBackgroundSessionDelegate& delegate) {
  auto host =
      std::make_unique<HostTransferHost>(runtime_, transfers_.store, transfers_.conditions, configuration);
  return std::make_unique<BackgroundTransfers>(runtime_, transfers_.center, std::move(host),
                                               std::move(configuration), delegate);
}

}  // namespace sable::platform::host

#pragma once

#include <filesystem>
#include <memory>

#include "platform/HTTPSession.h"
#include "platform/host/HostRuntime.h"

namespace sable::platform::host {

/// HTTP on libcurl, without a thread of its own.
///
/// A task's life, on the session's queue:
///
///     created --resume--> looking up --not stored, or to be validated--> running --> ended
///        |                    '---------- fresh in the cache ----------------------->  ^
///        '-- cancel, invalid request --------------------------------------------------'
///
/// (a session without cache goes from created to running). libcurl, its connections and buffers are
/// there from the first task until no task has run for the idle connection time-out; the next task
/// starts anew.
class HostHTTPSession final : public HTTPSession {
 public:
  /// `cacheFile`: where responses are kept when the configuration allows a cache.
  HostHTTPSession(HostRuntime& runtime, HTTPSessionConfiguration configuration,
                  std::filesystem::path cacheFile);
  /// Cancels what runs. Not on a queue that a task's progress waits for.
  ~HostHTTPSession() override;

  std::shared_ptr<HTTPDataTask> dataTask(HTTPRequest request, Completion completion) override;
  SerialQueue& callbackQueue() override;
  bool hasCache() const override;
  void purgeMemoryCache() override;

 private:
  class Core;
  class Task;
  const std::shared_ptr<Core> core_;
};

/// Makes sessions; caches lie below `cacheFolder`, in `http/cache.db`. One session with a cache can
/// use the file at a time; another one keeps its responses in memory only.
class HostHTTPSessions final : public HTTPSessions {
 public:
  HostHTTPSessions(HostRuntime& runtime, std::filesystem::path cacheFolder)
      : runtime_(runtime), cacheFolder_(std::move(cacheFolder)) {}

  std::unique_ptr<HTTPSession> session(HTTPSessionConfiguration configuration) override;
  /// Null: transfers that outlive the process are the next step.
  std::unique_ptr<HTTPBackgroundSession> backgroundSession(HTTPBackgroundSessionConfiguration configuration,
                                                           HTTPBackgroundSessionDelegate& delegate) override;

 private:
  HostRuntime& runtime_;
  const std::filesystem::path cacheFolder_;
};

}  // namespace sable::platform::host

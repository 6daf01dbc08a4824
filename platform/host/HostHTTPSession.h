#pragma once

#include <filesystem>
#include <functional>
#include <memory>

#include "platform/BackgroundTransfers.h"
#include "platform/HTTPSession.h"
#include "platform/NotificationCenter.h"
#include "platform/host/HostRuntime.h"

namespace sable::platform::host {

struct TransferFiles;
class TransferStore;

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
  /// The same with bodies in files, for a session without a cache; the result has no data.
  std::shared_ptr<HTTPDataTask> fileTask(HTTPRequest request, TransferFiles files, Completion completion);
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
  /// What background sessions need; references outlive them.
  struct Transfers {
    NotificationCenter& center;
    std::shared_ptr<TransferStore> store;
    std::function<TransferConditions()> conditions;
  };

  HostHTTPSessions(HostRuntime& runtime, std::filesystem::path cacheFolder, Transfers transfers)
      : runtime_(runtime), cacheFolder_(std::move(cacheFolder)), transfers_(std::move(transfers)) {}

  std::unique_ptr<HTTPSession> session(HTTPSessionConfiguration configuration) override;
  std::unique_ptr<HTTPBackgroundSession> backgroundSession(HTTPBackgroundSessionConfiguration configuration,
                                                           HTTPBackgroundSessionDelegate& delegate) override;

 private:
  HostRuntime& runtime_;
  const std::filesystem::path cacheFolder_;
  const Transfers transfers_;
};

}  // namespace sable::platform::host

#include "sabled/SBLRetryableNetworkRequest.h"

#include <utility>

namespace sable {

using platform::HTTPDataTask;
using platform::HTTPResult;
using platform::HTTPSession;
using platform::Runtime;

std::shared_ptr<HTTPDataTask> dataTaskWithRetryableRequest(
    Runtime& runtime, HTTPSession& session, const std::shared_ptr<const SBLRetryableNetworkRequest>& request,
    unsigned attempt, unsigned retriesRemaining, HTTPSession::Completion completion,
    std::function<void(HTTPDataTask&)> prepare) {
  auto finish = [&runtime, &session, request, attempt, retriesRemaining, completion = std::move(completion),
                 prepare](HTTPResult result) mutable {
    const bool expired = request->expire && runtime.now() > *request->expire;
    if (!result.error || expired || retriesRemaining == 0) {
      if (completion) completion(std::move(result));
      return;
    }
    auto retry = [&runtime, &session, request, attempt, retriesRemaining, completion = std::move(completion),
                  prepare = std::move(prepare)]() mutable {
      dataTaskWithRetryableRequest(runtime, session, request, attempt + 1, retriesRemaining - 1,
                                   std::move(completion), std::move(prepare))
          ->resume();
    };
    runtime.globalQueue(platform::QualityOfService::high)
        .after(request->delayOnFail ? kSBLRetryDelay : platform::Duration::zero(), std::move(retry))
        .detach();
  };
  auto task = session.dataTask(request->httpRequest, std::move(finish));
  if (prepare) prepare(*task);
  return task;
}

std::uint64_t mach_duration_to_milliseconds(std::uint64_t ticks) {
  // Ticks are nanoseconds here: the timebase is 1/1.
  return static_cast<std::uint64_t>(static_cast<double>(ticks) / 1'000'000);
}

}  // namespace sable

#include "sabled/FlusherTool.h"

#include <utility>

#include "SableKit/SBLRelayInterfaces.h"
#include "sabled/SableLogging.h"

namespace sable {
namespace {

using platform::RelayErrorCode;

/// A tool may be stopped in a debugger; one that is silent for a day is no tool any more.
constexpr platform::Duration kLongestSilence = std::chrono::hours(24);

}  // namespace

FlusherTool::FlusherTool(std::shared_ptr<platform::RelayConnection> connection,
                         std::shared_ptr<platform::SerialQueue> queue)
    : connection_(std::move(connection)), queue_(std::move(queue)) {}

void FlusherTool::workDone() {
  tellLeftOut();
  enqueue(SBLFlusherListenerRelay::workDone, {}, 0);
}

void FlusherTool::receiveFeedback(std::string json) {
  const std::size_t bytes = json.size();
  add(SBLFlusherListenerRelay::receiveFeedback, {std::move(json)}, bytes, 1);
}

void FlusherTool::receiveSessions(std::vector<std::string> envelopes) {
  std::size_t bytes = 0;
  for (const std::string& envelope : envelopes) bytes += envelope.size();
  const std::size_t records = envelopes.size();
  add(SBLFlusherListenerRelay::receiveSessions, {std::move(envelopes)}, bytes, records);
}

bool FlusherTool::isFull() const {
  return leftOut_ > 0 || waiting_.size() >= kFlusherWaitingCalls || waitingBytes_ >= kFlusherWaitingBytes;
}

void FlusherTool::leaveOut(std::uint64_t records) {
  queue_->assertIsCurrent();
  leftOut_ += records;
  if (waiting_.empty()) tellLeftOut();
}

void FlusherTool::add(std::size_t method, platform::RelayArguments arguments, std::size_t bytes,
                      std::size_t records) {
  if (isFull() || bytes > kFlusherWaitingBytes) return leaveOut(records);
  enqueue(method, std::move(arguments), bytes);
}

void FlusherTool::tellLeftOut() {
  if (const std::uint64_t count = std::exchange(leftOut_, 0); count > 0)
    enqueue(SBLFlusherListenerRelay::dropped, {count}, 0);
}

void FlusherTool::enqueue(std::size_t method, platform::RelayArguments arguments, std::size_t bytes) {
  waiting_.push_back({method, std::move(arguments), bytes});
  waitingBytes_ += bytes;
  sendWhatFits();
}

void FlusherTool::sendWhatFits() {
  while (!waiting_.empty() && unanswered_ < kFlusherWindowCalls && unansweredBytes_ < kFlusherWindowBytes) {
    Waiting next = std::move(waiting_.front());
    waiting_.pop_front();
    waitingBytes_ -= next.bytes;
    ++unanswered_;
    unansweredBytes_ += next.bytes;
    connection_->call(kSBLFlusherListenerRelay, next.method, std::move(next.arguments), kLongestSilence,
                      [weak = weak_from_this(), bytes = next.bytes,
                       queue = queue_](Expected<platform::RelayArguments> answer) {
                        queue->async([weak, bytes, answer = std::move(answer)] {
                          if (const auto self = weak.lock()) self->answered(bytes, answer);
                        });
                      });
  }
}

void FlusherTool::answered(std::size_t bytes, const Expected<platform::RelayArguments>& answer) {
  --unanswered_;
  unansweredBytes_ -= bytes;
  if (!answer) {
    const auto code = static_cast<RelayErrorCode>(answer.error().code);
    if (code == RelayErrorCode::disconnected) return;
    SableLogForCategory(SableLoggingCategoryFlusher)
        .error("remote proxy error: {}", answer.error().description());
    if (code == RelayErrorCode::timedOut) return connection_->invalidate();
  }
  sendWhatFits();
  if (waiting_.empty()) tellLeftOut();
}

}  // namespace sable

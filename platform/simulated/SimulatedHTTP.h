#pragma once

#include <functional>
#include <map>
#include <string>
#include <string_view>
#include <vector>

#include "platform/BackgroundTransfers.h"
#include "platform/FileManager.h"
#include "platform/HTTPSession.h"

namespace sable::platform::simulated {

struct SimulatedTransferDisk;

/// What the scripted service answers: a response, or an error in its place.
struct Scripted {
  int status = 200;
  HTTPHeaders headers;
  std::string body;
  std::string url;                  ///< after redirects; the request's when empty
  std::optional<Duration> latency;  ///< the service's default when absent
  std::optional<HTTPErrorCode> error;
};

/// A request as it reached the service.
struct RecordedRequest {
  HTTPRequest request;
  std::string path;      ///< of the URL, without its query
  std::string session;   ///< the session's label
  std::string proxyURL;  ///< empty for a direct connection
  MonotonicTime time{};
};

/// Stands for every server there is: answers by a handler for each path, in virtual time, and
/// remembers what it was asked. Used on the simulation's one thread.
class ScriptedService {
 public:
  using Handler = std::function<Scripted(const HTTPRequest&)>;

  /// Answers URLs whose path begins with `pathPrefix`; the longest prefix decides, and other URLs
  /// get a 404. A handler is called when the request is sent, not when the answer arrives.
  void on(std::string pathPrefix, Handler handler) { handlers_[std::move(pathPrefix)] = std::move(handler); }
  void on(std::string pathPrefix, Scripted answer) {
    on(std::move(pathPrefix), [answer = std::move(answer)](const HTTPRequest&) { return answer; });
  }

  void setDefaultLatency(Duration latency) { defaultLatency_ = latency; }
  /// Lets the next `count` requests fail, whatever their path; calls add up.
  void failNext(int count, HTTPErrorCode error) {
    faults_.insert(faults_.end(), static_cast<std::size_t>(count), error);
  }

  const std::vector<RecordedRequest>& requests() const { return requests_; }
  std::vector<RecordedRequest> requests(std::string_view pathPrefix) const;
  void forgetRequests() { requests_.clear(); }

  /// How often a session dropped its cache's memory.
  int memoryPurges() const { return memoryPurges_; }

  // For sessions.
  Scripted answer(RecordedRequest request);
  void noteMemoryPurge() { ++memoryPurges_; }

 private:
  std::map<std::string, Handler> handlers_;
  Duration defaultLatency_ = std::chrono::milliseconds(50);
  std::vector<HTTPErrorCode> faults_;
  std::vector<RecordedRequest> requests_;
  int memoryPurges_ = 0;
};

/// Sessions that talk to a ScriptedService. They keep the contract of HTTPSession: limits, time-outs,
/// cancelling, invalid requests; a cache is claimed as configured, but nothing is stored.
/// What background sessions keep, they keep here: a daemon that is made anew on the device goes on
/// with what an earlier one has left. The bodies of uploads come from `files`, the responses of
/// downloads go there.
class SimulatedHTTPSessions final : public HTTPSessions {
 public:
  SimulatedHTTPSessions(Runtime& runtime, NotificationCenter& center, FileManager& files);
  ~SimulatedHTTPSessions() override;

  ScriptedService& service() { return service_; }
  std::unique_ptr<HTTPSession> session(HTTPSessionConfiguration configuration) override;
  std::unique_ptr<HTTPBackgroundSession> backgroundSession(HTTPBackgroundSessionConfiguration configuration,
                                                           HTTPBackgroundSessionDelegate& delegate) override;

  /// What discretionary transfers wait for becomes this.
  void setConditions(const TransferConditions& conditions);
  /// From now on no transfer is accepted, with this errno value; 0 ends that.
  void failAccepting(int number);
  /// The transfers whose end no delegate has heard of.
  std::vector<BackgroundTransfer> pendingTransfers() const;

 private:
  Runtime& runtime_;
  NotificationCenter& center_;
  FileManager& files_;
  ScriptedService service_;
  const std::shared_ptr<SimulatedTransferDisk> disk_;
};

}  // namespace sable::platform::simulated

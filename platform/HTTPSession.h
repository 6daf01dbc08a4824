#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/Data.h"
#include "platform/Error.h"
#include "platform/Function.h"
#include "platform/Runtime.h"

namespace sable::platform {

/// Header fields in order (RFC 9110 section 5); names compare without letter case.
class HTTPHeaders {
 public:
  /// First value under `name`, or null.
  const std::string* find(std::string_view name) const;
  /// Replaces all fields of that name.
  void set(std::string_view name, std::string value);
  void add(std::string name, std::string value) { fields_.emplace_back(std::move(name), std::move(value)); }
  void remove(std::string_view name);

  const std::vector<std::pair<std::string, std::string>>& fields() const { return fields_; }

  /// "{name: value, ...}", for log lines.
  std::string description() const;

 private:
  std::vector<std::pair<std::string, std::string>> fields_;
};

enum class HTTPCachePolicy {
  useProtocol,  ///< what RFC 9111 says of a private cache
  ignoreLocal,  ///< always ask the server; the answer may still be stored
};

struct HTTPRequest {
  std::string url;
  std::string method = "GET";
  HTTPHeaders headers;
  Data body;
  HTTPCachePolicy cachePolicy = HTTPCachePolicy::useProtocol;
  double timeout = 60;   ///< seconds without a byte of progress, and to connect
  bool proxied = false;  ///< asks for the privacy proxy (NetworkServiceProxy)
  /// Without, a redirect (RFC 9110 section 15.4) is the answer, for the caller to judge.
  bool followsRedirects = true;
  /// Of the decoded body, where that is less than the session allows.
  std::size_t maximumResponseBytes = SIZE_MAX;
};

struct HTTPResponse {
  std::string url;  ///< after redirects
  int status = 0;
  HTTPHeaders headers;
  bool fromCache = false;

  /// "status url {headers}", for log lines.
  std::string description() const;
};

/// Where the time of a task went; offsets from its start (RFC 9110 has no such thing: the fields
/// are libcurl's). A phase that did not happen, such as connecting on a kept-alive connection, is 0.
struct HTTPTaskTiming {
  WallTime start{};
  Duration nameLookup{}, connect{}, secureConnect{}, requestStart{}, responseStart{}, redirect{}, total{};
  std::int64_t requestHeaderBytes = 0, requestBodyBytes = 0;
  std::int64_t responseHeaderBytes = 0, responseBodyBytes = 0;
  std::string protocol;     ///< "http/1.1", "h2"
  std::string peerAddress;  ///< numeric; empty when none
  std::uint16_t peerPort = 0;
  bool reusedConnection = false, proxied = false;
  int redirects = 0;
};

inline constexpr std::string_view kHTTPErrorDomain = "HTTPErrorDomain";
/// Transport errors. They leave the process in feedback: never renumber.
enum class HTTPErrorCode : std::int64_t {
  badURL = 1,
  cannotFindHost = 2,
  cannotConnect = 3,
  timedOut = 4,
  connectionLost = 5,
  secureConnectionFailed = 6,
  tooManyRedirects = 7,
  responseTooLarge = 8,  ///< body, decompressed body, or header section past its limit
  badResponse = 9,       ///< not HTTP, or cut off before its announced end
  cancelled = 10,
  notAllowed = 11,  ///< scheme other than http and https, also after a redirect
  proxyFailed = 12,
  other = 13,
};

/// An error of kHTTPErrorDomain.
Error httpError(HTTPErrorCode code, std::string reason);

/// What is wrong with a request before anything is sent: no absolute http or https URL, or a method
/// or header that would not be one line of its own. Tasks end with it.
std::optional<Error> invalidity(const HTTPRequest& request);

/// Whether HTTPDataTask::setProxy can use it: an absolute URL of scheme http, https or socks5h.
bool isProxyURL(std::string_view text);

/// What a data task ended with. Exactly one of two things holds: `error` is set and the rest is
/// what had arrived until then, or `error` is empty and `response` is set.
struct HTTPResult {
  Data data;  ///< null when not even an empty body arrived
  std::optional<HTTPResponse> response;
  std::optional<Error> error;
  HTTPTaskTiming timing;
};

/// One transfer; runs to its end also when nobody holds it. Any thread.
class HTTPDataTask {
 public:
  virtual ~HTTPDataTask() = default;
  /// Starts it. Idempotent.
  virtual void resume() = 0;
  /// Ends it with HTTPErrorCode::cancelled unless it has ended already.
  virtual void cancel() = 0;
  /// Sends it through a proxy (a URL of scheme http, https or socks5h). Before resume().
  virtual void setProxy(std::string proxyURL) = 0;
};

struct HTTPSessionConfiguration {
  std::string label;
  bool allowsCache = false;
  std::size_t cacheMemoryCapacity = 0;  ///< bytes
  std::size_t cacheDiskCapacity = 0;    ///< bytes
  bool tcpFastOpen = false;
  bool tlsSessionTickets = false;
  bool pipelining = false;  ///< more than one request on a connection, where HTTP/2 can
  Duration idleConnectionTimeout = std::chrono::seconds(60);
  std::size_t maximumResponseBytes = 8u << 20;  ///< of the decoded body
  std::size_t maximumHeaderBytes = 256u << 10;
  int maximumRedirects = 10;
};

/// Transfers that share connections, TLS sessions, name lookups and a response cache. Any thread.
/// The session is kept for the life of the process; it costs nothing before its first task.
class HTTPSession {
 public:
  virtual ~HTTPSession() = default;

  using Completion = Function<void(HTTPResult)>;

  /// A task that is not yet resumed. `completion` is called exactly once, on callbackQueue(), and
  /// may be empty. An invalid request completes with an error like any other failure.
  virtual std::shared_ptr<HTTPDataTask> dataTask(HTTPRequest request, Completion completion) = 0;

  virtual SerialQueue& callbackQueue() = 0;

  virtual bool hasCache() const = 0;
  /// Drops the cache's memory, keeps what is on disk.
  virtual void purgeMemoryCache() = 0;
};

// platform/HTTPBackgroundSession.h
class HTTPBackgroundSession;
class HTTPBackgroundSessionDelegate;
struct HTTPBackgroundSessionConfiguration;

class HTTPSessions {
 public:
  virtual ~HTTPSessions() = default;
  virtual std::unique_ptr<HTTPSession> session(HTTPSessionConfiguration configuration) = 0;
  /// Goes on with the transfers that an earlier process has left under the configuration's identifier;
  /// costs next to nothing where there are none. `delegate` outlives the session, and may be called
  /// before this returns. One session of an identifier at a time.
  virtual std::unique_ptr<HTTPBackgroundSession> backgroundSession(
      HTTPBackgroundSessionConfiguration configuration, HTTPBackgroundSessionDelegate& delegate) = 0;
};

}  // namespace sable::platform

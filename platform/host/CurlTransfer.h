#pragma once

#include <curl/curl.h>

#include <memory>
#include <optional>
#include <string>

#include "platform/Function.h"
#include "platform/HTTPSession.h"
#include "platform/host/Descriptor.h"

namespace sable::platform::host {

struct CurlEasyDeleter {
  void operator()(CURL* easy) const { curl_easy_cleanup(easy); }
};
using CurlEasy = std::unique_ptr<CURL, CurlEasyDeleter>;

/// Bodies of a transfer that are not held in memory.
struct TransferFiles {
  Descriptor body;  ///< what to send, from its start; none: nothing is sent
  std::int64_t bodyBytes = 0;
  Descriptor sink;             ///< where the response's body goes; none: it is dropped
  std::optional<Error> error;  ///< why there is nothing to open: the transfer ends with it
  Function<void(std::int64_t sent, std::int64_t expected)> progress;  ///< on the session's queue
};

/// One request on libcurl: sets up an easy handle, gathers what arrives within the session's limits
/// and tells the outcome in our terms. Lives on the session's queue; stays where it is while libcurl
/// works on it.
class CurlTransfer {
 public:
  /// `request` outlives the transfer; `conditions` are sent with its headers. `proxyURL` empty: a
  /// direct connection, for the environment's proxies are never asked. `files` stand in for the bodies
  /// of request and result, and outlive the transfer; null: there are none.
  CurlTransfer(const Runtime& runtime, const HTTPSessionConfiguration& configuration,
               const HTTPRequest& request, HTTPHeaders conditions, std::string proxyURL,
               TransferFiles* files);
  CurlTransfer(const CurlTransfer&) = delete;
  CurlTransfer& operator=(const CurlTransfer&) = delete;

  /// Sets all options of `easy`, which may have served others, and keeps it until release().
  void prepare(CurlEasy easy);
  CURL* easy() const { return easy_.get(); }
  CurlEasy release() { return std::move(easy_); }

  /// When the transfer has made no progress for too long; moves with every byte.
  MonotonicTime deadline() const { return lastProgress_ + timeout_; }

  /// What has come of it; `code` is libcurl's verdict. Takes the body along.
  HTTPResult result(CURLcode code);
  /// The same for an end that libcurl did not decide.
  HTTPResult result(Error error);

  WallTime startTime() const { return startTime_; }

 private:
  struct ListDeleter {
    void operator()(curl_slist* list) const { curl_slist_free_all(list); }
  };

  void setTransport();
  void setRequest();
  void setHeaders();
  void addHeaders(const HTTPHeaders& headers);
  void addHeaderLine(const std::string& line);
  void noteProgress() { lastProgress_ = runtime_.ticks(); }
  Error error(CURLcode code) const;
  HTTPResult arrived();

  bool sendsBody() const { return request_.body || (files_ != nullptr && files_->body); }
  std::size_t bodyBytes() const;
  void setBody();
  void sent(curl_off_t bytes);
  bool store(const char* bytes, std::size_t count);
  std::size_t takeBody(const char* bytes, std::size_t count);
  std::size_t takeHeader(std::string_view line);

  const Runtime& runtime_;
  const HTTPSessionConfiguration& configuration_;
  const HTTPRequest& request_;
  const HTTPHeaders conditions_;
  const std::string proxyURL_;
  TransferFiles* const files_;
  const Duration timeout_;
  const std::size_t maximumBytes_;

  CurlEasy easy_;
  std::unique_ptr<curl_slist, ListDeleter> headerLines_;
  WallTime startTime_{};
  MonotonicTime lastProgress_{};
  curl_off_t uploaded_ = 0;
  std::string body_;
  bool bodyBegun_ = false;
  std::size_t bodyBytes_ = 0;    // that have come
  int storeError_ = 0;           // why they could not be kept
  std::size_t headerBytes_ = 0;  // of the current header section and the interim ones before it
  bool interim_ = false;
  bool headersEnded_ = false;
  const char* refusal_ = nullptr;  // why we stopped it ourselves
  char errorText_[CURL_ERROR_SIZE] = "";
};

}  // namespace sable::platform::host

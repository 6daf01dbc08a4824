#include "platform/host/CurlTransfer.h"

#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <string_view>

#include "platform/host/CurlOutcome.h"

namespace sable::platform::host {
namespace {

constexpr const char* kHeadersTooLarge = "headers are larger than the session allows";

constexpr double kLongestTimeout = 7 * 86400;

bool isBlank(std::string_view text) {
  return text.find_first_not_of(" \t") == std::string_view::npos;
}

}  // namespace

CurlTransfer::CurlTransfer(const Runtime& runtime, const HTTPSessionConfiguration& configuration,
                           const HTTPRequest& request, HTTPHeaders conditions, std::string proxyURL,
                           TransferFiles* files)
    : runtime_(runtime),
      configuration_(configuration),
      request_(request),
      conditions_(std::move(conditions)),
      proxyURL_(std::move(proxyURL)),
      files_(files),
      timeout_(fromSeconds(std::clamp(request_.timeout, 0.001, kLongestTimeout))),
      maximumBytes_(std::min(configuration_.maximumResponseBytes, request_.maximumResponseBytes)) {}

void CurlTransfer::prepare(CurlEasy easy) {
  easy_ = std::move(easy);
  startTime_ = runtime_.now();
  noteProgress();
  setTransport();
  setRequest();
  setHeaders();
}

void CurlTransfer::setTransport() {
  CURL* easy = easy_.get();
  curl_easy_setopt(easy, CURLOPT_ERRORBUFFER, errorText_);
  curl_easy_setopt(easy, CURLOPT_NOSIGNAL, 1L);
  curl_easy_setopt(easy, CURLOPT_QUICK_EXIT, 1L);  // cancelling does not wait for a name lookup
  curl_easy_setopt(easy, CURLOPT_PROTOCOLS_STR, "http,https");
  curl_easy_setopt(easy, CURLOPT_REDIR_PROTOCOLS_STR, "http,https");
  curl_easy_setopt(easy, CURLOPT_FOLLOWLOCATION, request_.followsRedirects ? 1L : 0L);
  curl_easy_setopt(easy, CURLOPT_MAXREDIRS, static_cast<long>(configuration_.maximumRedirects));
  curl_easy_setopt(easy, CURLOPT_HTTP_VERSION, CURL_HTTP_VERSION_2TLS);
  curl_easy_setopt(easy, CURLOPT_SSLVERSION, CURL_SSLVERSION_TLSv1_2);
  curl_easy_setopt(easy, CURLOPT_SSL_SESSIONID_CACHE, configuration_.tlsSessionTickets ? 1L : 0L);
  curl_easy_setopt(easy, CURLOPT_TCP_FASTOPEN, configuration_.tcpFastOpen ? 1L : 0L);
  curl_easy_setopt(easy, CURLOPT_PIPEWAIT, configuration_.pipelining ? 1L : 0L);
  const auto idle = std::chrono::ceil<std::chrono::seconds>(configuration_.idleConnectionTimeout);
  curl_easy_setopt(easy, CURLOPT_MAXAGE_CONN, std::max(1L, static_cast<long>(idle.count())));
  curl_easy_setopt(easy, CURLOPT_PROXY, proxyURL_.c_str());
  curl_easy_setopt(easy, CURLOPT_SUPPRESS_CONNECT_HEADERS, 1L);
  curl_easy_setopt(
      easy, CURLOPT_PREREQFUNCTION, +[](void* self, char*, char*, int, int) {
        static_cast<CurlTransfer*>(self)->noteProgress();
        return CURL_PREREQFUNC_OK;
      });
  curl_easy_setopt(easy, CURLOPT_PREREQDATA, this);
}

void CurlTransfer::setRequest() {
  CURL* easy = easy_.get();
  curl_easy_setopt(easy, CURLOPT_URL, request_.url.c_str());
  curl_easy_setopt(easy, CURLOPT_PATH_AS_IS, 1L);
  curl_easy_setopt(easy, CURLOPT_ACCEPT_ENCODING, "");
  const bool posts = request_.method == "POST";
  if (request_.method == "HEAD") {
    curl_easy_setopt(easy, CURLOPT_NOBODY, 1L);
  } else if (posts || sendsBody()) {
    setBody();
  }
  if (!posts && request_.method != "HEAD" && (sendsBody() || request_.method != "GET")) {
    curl_easy_setopt(easy, CURLOPT_CUSTOMREQUEST, request_.method.c_str());
  }
  curl_easy_setopt(
      easy, CURLOPT_WRITEFUNCTION, +[](char* bytes, std::size_t, std::size_t count, void* self) {
        return static_cast<CurlTransfer*>(self)->takeBody(bytes, count);
      });
  curl_easy_setopt(easy, CURLOPT_WRITEDATA, this);
  curl_easy_setopt(
      easy, CURLOPT_HEADERFUNCTION, +[](char* bytes, std::size_t, std::size_t count, void* self) {
        return static_cast<CurlTransfer*>(self)->takeHeader({bytes, count});
      });
  curl_easy_setopt(easy, CURLOPT_HEADERDATA, this);
}

void CurlTransfer::setBody() {
  CURL* easy = easy_.get();
  curl_easy_setopt(easy, CURLOPT_POST, 1L);
  curl_easy_setopt(easy, CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(bodyBytes()));
  if (files_ != nullptr && files_->body) {
    // Sent again where a redirect or a connection that had gone stale asks for it.
    curl_easy_setopt(easy, CURLOPT_POSTREDIR, static_cast<long>(CURL_REDIR_POST_301 | CURL_REDIR_POST_302));
    curl_easy_setopt(
        easy, CURLOPT_READFUNCTION, +[](char* bytes, std::size_t, std::size_t count, void* self) {
          const ssize_t got = ::read(static_cast<TransferFiles*>(self)->body.number(), bytes, count);
          return got < 0 ? std::size_t{CURL_READFUNC_ABORT} : static_cast<std::size_t>(got);
        });
    curl_easy_setopt(easy, CURLOPT_READDATA, files_);
    curl_easy_setopt(
        easy, CURLOPT_SEEKFUNCTION, +[](void* self, curl_off_t offset, int origin) -> int {
          const int body = static_cast<TransferFiles*>(self)->body.number();
          return ::lseek(body, offset, origin) < 0 ? CURL_SEEKFUNC_FAIL : CURL_SEEKFUNC_OK;
        });
    curl_easy_setopt(easy, CURLOPT_SEEKDATA, files_);
  } else {
    curl_easy_setopt(easy, CURLOPT_POSTFIELDS, request_.body ? request_.body->data() : "");
  }
  if (!sendsBody()) return;
  curl_easy_setopt(easy, CURLOPT_NOPROGRESS, 0L);
  curl_easy_setopt(
      easy, CURLOPT_XFERINFOFUNCTION,
      +[](void* self, curl_off_t, curl_off_t, curl_off_t, curl_off_t uploaded) -> int {
        static_cast<CurlTransfer*>(self)->sent(uploaded);
        return 0;
      });
  curl_easy_setopt(easy, CURLOPT_XFERINFODATA, this);
}

void CurlTransfer::sent(curl_off_t bytes) {
  if (std::exchange(uploaded_, bytes) == bytes) return;
  noteProgress();
  if (files_ != nullptr && files_->progress) files_->progress(bytes, files_->bodyBytes);
}

std::size_t CurlTransfer::bodyBytes() const {
  if (files_ != nullptr && files_->body) return static_cast<std::size_t>(files_->bodyBytes);
  return request_.body ? request_.body->size() : 0;
}

void CurlTransfer::setHeaders() {
  addHeaders(request_.headers);
  addHeaders(conditions_);
  if (sendsBody() || request_.method == "POST") {
    // A name without a value takes libcurl's own field out.
    for (const char* unwanted : {"Expect", "Content-Type"}) {
      if (request_.headers.find(unwanted) == nullptr) addHeaderLine(std::string(unwanted) + ':');
    }
  }
  curl_easy_setopt(easy_.get(), CURLOPT_HTTPHEADER, headerLines_.get());
}

void CurlTransfer::addHeaders(const HTTPHeaders& headers) {
  for (const auto& [name, value] : headers.fields()) {
    addHeaderLine(isBlank(value) ? name + ';' : name + ": " + value);
  }
}

void CurlTransfer::addHeaderLine(const std::string& line) {
  curl_slist* first = curl_slist_append(headerLines_.get(), line.c_str());
  if (first == nullptr) return;
  static_cast<void>(headerLines_.release());
  headerLines_.reset(first);
}

std::size_t CurlTransfer::takeBody(const char* bytes, std::size_t count) {
  noteProgress();
  if (!std::exchange(bodyBegun_, true) && files_ == nullptr) {
    curl_off_t announced = -1;
    curl_easy_getinfo(easy_.get(), CURLINFO_CONTENT_LENGTH_DOWNLOAD_T, &announced);
    const auto limit = static_cast<curl_off_t>(maximumBytes_);
    if (announced > 0) body_.reserve(static_cast<std::size_t>(std::min(announced, limit)));
  }
  const std::size_t room = maximumBytes_ - bodyBytes_;
  if (!store(bytes, std::min(count, room))) return 0;
  bodyBytes_ += std::min(count, room);
  if (count <= room) return count;
  refusal_ = "body is larger than allowed";
  return 0;
}

bool CurlTransfer::store(const char* bytes, std::size_t count) {
  if (files_ == nullptr) {
    body_.append(bytes, count);
    return true;
  }
  while (files_->sink && count > 0) {
    const ssize_t written = ::write(files_->sink.number(), bytes, count);
    if (written < 0 && errno == EINTR) continue;
    if (written < 0) {
      storeError_ = errno;
      return false;
    }
    bytes += written;
    count -= static_cast<std::size_t>(written);
  }
  return true;
}

std::size_t CurlTransfer::takeHeader(std::string_view line) {
  noteProgress();
  if (line.starts_with("HTTP/")) {
    // Interim responses (1xx) count with what follows them, or they could go on for ever.
    headersEnded_ = false;
    if (!interim_) headerBytes_ = 0;
    const auto status = line.substr(std::min(line.find(' '), line.size() - 1) + 1);
    interim_ = status.starts_with('1');
  }
  headerBytes_ += line.size();
  if (line == "\r\n" || line == "\n") headersEnded_ = true;
  if (headerBytes_ <= configuration_.maximumHeaderBytes) return line.size();
  refusal_ = kHeadersTooLarge;
  return 0;
}

Error CurlTransfer::error(CURLcode code) const {
  // libcurl takes a single header line of at most 100 KiB, and calls a longer one lack of memory.
  const bool hugeLine = code == CURLE_OUT_OF_MEMORY && headerBytes_ > 0 && !headersEnded_;
  if (refusal_ != nullptr || hugeLine) {
    return httpError(HTTPErrorCode::responseTooLarge, hugeLine ? kHeadersTooLarge : refusal_);
  }
  if (storeError_ != 0) {
    return httpError(HTTPErrorCode::other, posixError(storeError_, "body cannot be kept").reason);
  }
  if (code == CURLE_OK) return httpError(HTTPErrorCode::badResponse, "connection closed within the headers");
  std::string reason = errorText_[0] != '\0' ? errorText_ : curl_easy_strerror(code);
  const auto meaning = httpErrorCode(easy_.get(), code, reason, !proxyURL_.empty());
  return httpError(meaning, std::move(reason));
}

HTTPResult CurlTransfer::arrived() {
  HTTPResult result;
  result.response = response(easy_.get());
  if (bodyBegun_ && files_ == nullptr) result.data = makeData(std::move(body_));
  result.timing = timing(easy_.get(), bodyBytes());
  result.timing.start = startTime_;
  result.timing.proxied = !proxyURL_.empty();
  return result;
}

HTTPResult CurlTransfer::result(CURLcode code) {
  if (code != CURLE_OK || !headersEnded_) return result(error(code));
  HTTPResult result = arrived();
  if (!result.data) result.data = makeData({});
  return result;
}

HTTPResult CurlTransfer::result(Error error) {
  HTTPResult result = arrived();
  result.error = std::move(error);
  return result;
}

}  // namespace sable::platform::host

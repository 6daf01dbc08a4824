#include "platform/host/CurlOutcome.h"

namespace sable::platform::host {
namespace {

long number(CURL* easy, CURLINFO what) {
  long value = 0;
  curl_easy_getinfo(easy, what, &value);
  return value;
}

curl_off_t size(CURL* easy, CURLINFO what) {
  curl_off_t value = 0;
  curl_easy_getinfo(easy, what, &value);
  return value;
}

std::string text(CURL* easy, CURLINFO what) {
  const char* value = nullptr;
  curl_easy_getinfo(easy, what, &value);
  return value == nullptr ? std::string() : std::string(value);
}

Duration offset(CURL* easy, CURLINFO what) {
  return std::chrono::microseconds(size(easy, what));
}

std::string protocol(CURL* easy) {
  switch (number(easy, CURLINFO_HTTP_VERSION)) {
    case CURL_HTTP_VERSION_1_0:
      return "http/1.0";
    case CURL_HTTP_VERSION_1_1:
      return "http/1.1";
    case CURL_HTTP_VERSION_2_0:
      return "h2";
    default:
      return {};
  }
}

bool contains(std::string_view text, std::string_view part) {
  return text.find(part) != std::string_view::npos;
}

HTTPErrorCode receiveErrorCode(CURL* easy, std::string_view errorText) {
  const long answerOfProxy = number(easy, CURLINFO_HTTP_CONNECTCODE);
  if (answerOfProxy >= 300) return HTTPErrorCode::proxyFailed;
  return contains(errorText, "chunked-encoding") ? HTTPErrorCode::badResponse : HTTPErrorCode::connectionLost;
}

}  // namespace

HTTPErrorCode httpErrorCode(CURL* easy, CURLcode code, std::string_view errorText, bool proxied) {
  using enum HTTPErrorCode;
  switch (code) {
    case CURLE_URL_MALFORMAT:
      return badURL;
    case CURLE_COULDNT_RESOLVE_HOST:
      return cannotFindHost;
    case CURLE_COULDNT_RESOLVE_PROXY:
    case CURLE_PROXY:
      return proxyFailed;
    case CURLE_COULDNT_CONNECT:
      return proxied ? proxyFailed : cannotConnect;
    case CURLE_OPERATION_TIMEDOUT:
      return timedOut;
    case CURLE_RECV_ERROR:
      return receiveErrorCode(easy, errorText);
    case CURLE_SEND_ERROR:
    case CURLE_GOT_NOTHING:
      return connectionLost;
    case CURLE_SSL_CONNECT_ERROR:
    case CURLE_SSL_CERTPROBLEM:
    case CURLE_SSL_CIPHER:
    case CURLE_SSL_CACERT_BADFILE:
    case CURLE_SSL_ISSUER_ERROR:
    case CURLE_SSL_INVALIDCERTSTATUS:
    case CURLE_SSL_CLIENTCERT:
    case CURLE_PEER_FAILED_VERIFICATION:
      return secureConnectionFailed;
    case CURLE_TOO_MANY_REDIRECTS:
      return tooManyRedirects;
    case CURLE_UNSUPPORTED_PROTOCOL:
      return contains(errorText, "HTTP/0.9") ? badResponse : notAllowed;
    case CURLE_PARTIAL_FILE:
    case CURLE_WEIRD_SERVER_REPLY:
    case CURLE_BAD_CONTENT_ENCODING:
    case CURLE_HTTP2:
    case CURLE_HTTP2_STREAM:
      return badResponse;
    case CURLE_FILESIZE_EXCEEDED:
      return responseTooLarge;
    default:
      return other;
  }
}

std::optional<HTTPResponse> response(CURL* easy) {
  HTTPResponse result;
  result.status = static_cast<int>(number(easy, CURLINFO_RESPONSE_CODE));
  if (result.status == 0) return std::nullopt;
  result.url = text(easy, CURLINFO_EFFECTIVE_URL);
  for (curl_header* field = nullptr;
       (field = curl_easy_nextheader(easy, CURLH_HEADER, -1, field)) != nullptr;) {
    const std::string_view value = field->value;
    // libcurl leaves the line end in an empty value.
    result.headers.add(field->name, std::string(value.substr(0, value.find_last_not_of(" \t\r\n") + 1)));
  }
  return result;
}

HTTPTaskTiming timing(CURL* easy, std::size_t bodyBytes) {
  // A body up to this size leaves together with the headers, and libcurl counts it as one of them.
  constexpr std::size_t kSentWithHeaders = 64 * 1024;
  HTTPTaskTiming result;
  result.reusedConnection =
      number(easy, CURLINFO_NUM_CONNECTS) == 0 && number(easy, CURLINFO_REQUEST_SIZE) > 0;
  if (!result.reusedConnection) {
    result.nameLookup = offset(easy, CURLINFO_NAMELOOKUP_TIME_T);
    result.connect = offset(easy, CURLINFO_CONNECT_TIME_T);
    result.secureConnect = offset(easy, CURLINFO_APPCONNECT_TIME_T);
  }
  result.requestStart = offset(easy, CURLINFO_PRETRANSFER_TIME_T);
  result.responseStart = offset(easy, CURLINFO_STARTTRANSFER_TIME_T);
  result.redirect = offset(easy, CURLINFO_REDIRECT_TIME_T);
  result.total = offset(easy, CURLINFO_TOTAL_TIME_T);
  result.requestBodyBytes = size(easy, CURLINFO_SIZE_UPLOAD_T);
  result.requestHeaderBytes = number(easy, CURLINFO_REQUEST_SIZE);
  if (bodyBytes < kSentWithHeaders && result.requestHeaderBytes > result.requestBodyBytes) {
    result.requestHeaderBytes -= result.requestBodyBytes;
  }
  result.responseHeaderBytes = number(easy, CURLINFO_HEADER_SIZE);
  result.responseBodyBytes = size(easy, CURLINFO_SIZE_DOWNLOAD_T);
  result.protocol = protocol(easy);
  result.peerAddress = text(easy, CURLINFO_PRIMARY_IP);
  result.peerPort = static_cast<std::uint16_t>(number(easy, CURLINFO_PRIMARY_PORT));
  result.redirects = static_cast<int>(number(easy, CURLINFO_REDIRECT_COUNT));
  return result;
}

}  // namespace sable::platform::host

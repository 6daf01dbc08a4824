#pragma once

#include <curl/curl.h>

#include "platform/HTTPSession.h"

/// What libcurl knows of a transfer that has ended, in our terms.
namespace sable::platform::host {

/// `errorText` is libcurl's message for the transfer, which tells apart a few meanings of one code.
HTTPErrorCode httpErrorCode(CURL* easy, CURLcode code, std::string_view errorText, bool proxied);

/// Status, final URL and the headers of the last response; nullopt when none has begun.
std::optional<HTTPResponse> response(CURL* easy);

/// All but `start` and `proxied`. `bodyBytes` is the size of the body that was to be sent.
HTTPTaskTiming timing(CURL* easy, std::size_t bodyBytes);

}  // namespace sable::platform::host

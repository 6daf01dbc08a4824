#pragma once

#include <optional>
#include <string>

#include "platform/HTTPSession.h"

/// What RFC 9111 lets a private cache do, as functions of values. Freshness is only what the server
/// states (max-age, Expires): nothing is guessed from Last-Modified (section 4.2.2), and nothing
/// stale is served unasked (section 4.2.4), which makes must-revalidate hold by itself.
namespace sable::platform::host {

/// A response as the cache keeps it: the body is decoded, the headers are the server's.
struct StoredResponse {
  std::string url;
  int status = 0;
  HTTPHeaders headers;
  HTTPHeaders varied;  ///< the request's fields that Vary names (section 4.1)
  Data body;
  WallTime requestTime{};
  WallTime responseTime{};
};

/// Whether a stored response may answer this request, or its answer be stored: a GET of a whole
/// resource on which the caller put no condition of its own.
bool isCacheable(const HTTPRequest& request);

/// Whether the answer to a cacheable request is worth keeping (section 3): its status is one that
/// may be reused, nobody forbids it, and it is fresh for a while or can be validated.
bool isStorable(const HTTPRequest& request, int status, const HTTPHeaders& headers);

enum class Reuse {
  asItIs,           ///< answers the request without asking the server
  afterValidation,  ///< may answer it when the server says 304
  never,            ///< is the answer to another request, or cannot be validated
};
Reuse reuse(const StoredResponse& stored, const HTTPRequest& request, WallTime now);

/// Seconds since the origin server made or last validated the response (section 4.2.3).
Duration currentAge(const StoredResponse& stored, WallTime now);

/// The fields of a request that select the response among the variants of its URL.
HTTPHeaders variedFields(const HTTPHeaders& request, const HTTPHeaders& response);

/// Makes a request conditional on `stored` being out of date (section 4.3.1).
void addConditions(const StoredResponse& stored, HTTPHeaders& request);

/// `stored` with the headers and times of a 304 that confirmed it (section 3.2).
StoredResponse validated(const StoredResponse& stored, const HTTPHeaders& notModified, WallTime requestTime,
                         WallTime responseTime);

/// Whether a response to this request makes what is stored under its URL invalid (section 4.4).
bool invalidates(const HTTPRequest& request, int status);

}  // namespace sable::platform::host

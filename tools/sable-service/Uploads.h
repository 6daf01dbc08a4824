#pragma once

#include <mutex>
#include <set>
#include <string>

#include "Message.h"

namespace service {

/// Takes feedback and crowdsourcing uploads and checks them as a strict reader of the wire does:
///
///   Content-Encoding: deflate      the body is a raw deflate stream (RFC 1951, no zlib header), at most 64
///   MiB
///                                  inflated, with nothing behind its end; another coding is answered 415
///   X-Kestrel-Digest               the SHA-512 of the inflated bytes, in hex of either case or in base64
///   the inflated bytes             one JSON document of at most 512 levels
///
/// Anything else is answered 400, with the reason in the body and the record. A digest that was accepted
/// before on the same path is recognised as a repetition and answered 200 all the same.
///
/// The record gets "digest_ok", "digest" (hex, of what was received), "repeated", "json" (the document) and,
/// when refused, "reason". Safe from any thread.
class Uploads {
 public:
  /// `accepted` is false when the client will be told that the upload failed: it is checked, but not
  /// remembered.
  Answer receive(const Request& request, bool accepted);

 private:
  std::mutex mutex_;
  std::set<std::pair<std::string, std::string>> seen_;
};

}  // namespace service

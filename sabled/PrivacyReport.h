#pragma once

#include <memory>
#include <string>
#include <vector>

#include "platform/UUID.h"
#include "sabled/RequestTrace.h"

namespace sable {

class SBLBag;

/// What the device would tell about itself now, in which requests, and what changes that. Taken from
/// traces of the requests' own builders, so that it cannot say anything else than they send.
struct PrivacyReport {
  struct Request {
    std::string name;  ///< "search"
    RequestTrace trace;
    bool throughProxy = false;
  };
  struct Unasked {
    std::string name;
    std::string why;
  };

  std::string userAgent;              ///< of the client that it is about
  std::shared_ptr<const SBLBag> bag;  ///< or null
  std::vector<Request> requests;      ///< that would be sent, if asked for
  std::vector<Unasked> unasked;       ///< that would not
  UUID userGuid;
  double userGuidRotatesIn = 0;                 ///< seconds
  std::vector<std::string> signedApplications;  ///< that the signature of installed ones tells of
  bool diagnosticsAllowed = false;

  /// The JSON text that diagnostics show; docs/relay.md describes it.
  std::string json() const;
};

}  // namespace sable

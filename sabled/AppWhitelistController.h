#pragma once

#include <atomic>
#include <memory>
#include <optional>
#include <string>

#include "platform/NotificationCenter.h"
#include "platform/Runtime.h"
#include "sabled/AppWhitelist.h"

namespace sable {

class Assembly;

/// Keeps the signature of those installed applications that the service's allow-list has, which goes
/// with requests. It is worked out at the start when none was saved, when a new allow-list has come,
/// and 60 s after the last change of the installed applications; it is saved as the setting
/// "SBLAppWhitelistSignature", and the applications that it tells of, for the device's owner, as
/// "SBLAppWhitelistApplications". No signature is a result as well, and takes both away. Any thread.
class AppWhitelistController {
 public:
  explicit AppWhitelistController(Assembly& assembly);
  ~AppWhitelistController();

  /// The last result; never waits for the next one.
  std::optional<std::string> whitelistSignature() const;

  /// The identifiers of the applications that the last result tells of; they are never sent.
  std::vector<std::string> signedApplications() const;

 private:
  void armTimer();
  void _handleNewWhitelistFile(const platform::Notification& notification);
  void _generateWhitelistSignature();
  std::optional<AppWhitelistSignature> _generate();

  Assembly& assembly_;
  const std::shared_ptr<platform::SerialQueue> backgroundQueue_;
  const std::shared_ptr<platform::ConcurrentQueue> signatureQueue_;

  std::atomic<bool> generating_{false};

  platform::Timer timer_;                                    ///< on backgroundQueue_
  std::optional<AppWhitelistSignature> whitelistSignature_;  ///< on signatureQueue_

  platform::NotificationCenter::Token registerToken_, newFileToken_;
};

}  // namespace sable

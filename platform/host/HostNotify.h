#pragma once

#include <memory>
#include <string_view>

#include "platform/Notify.h"
#include "platform/Process.h"
#include "platform/host/HostRuntime.h"

namespace sable::platform::host {

/// Notifications as D-Bus signals on the session bus: Posted(s name) of interface
/// com.kestrel.Notify at /com/kestrel/notify. They are rare, so each has a connection of its own,
/// made on a background queue; nothing stays open in between.
class HostNotify final : public Notify {
 public:
  /// The bus is the one that $DBUS_SESSION_BUS_ADDRESS names.
  explicit HostNotify(HostRuntime& runtime);
  ~HostNotify() override;

  void post(std::string_view name) override;

  Availability availability() const;

 private:
  struct Bus;
  const std::shared_ptr<Bus> bus_;
  const std::shared_ptr<SerialQueue> queue_;
};

}  // namespace sable::platform::host

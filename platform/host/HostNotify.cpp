#include "platform/host/HostNotify.h"

#include <systemd/sd-bus.h>

#include <atomic>
#include <cstdlib>
#include <system_error>

#include "platform/Log.h"

namespace sable::platform::host {

struct HostNotify::Bus {
  Bus(HostReactor& itsReactor, std::string itsAddress)
      : reactor(itsReactor), address(std::move(itsAddress)) {}

  HostReactor& reactor;
  const std::string address;
  std::atomic<bool> failureLogged = false;

  void logOnce(std::string_view reason) {
    if (!failureLogged.exchange(true)) platformLog().info("notifications reach no other process: {}", reason);
  }

  void emit(const std::string& name) {
    const HostReactor::Blocking untilTheBusHasIt(reactor);
    sd_bus* bus = nullptr;
    int result = ::sd_bus_new(&bus);
    if (result >= 0) result = ::sd_bus_set_address(bus, address.c_str());
    if (result >= 0) result = ::sd_bus_set_bus_client(bus, 1);
    if (result >= 0) result = ::sd_bus_start(bus);
    if (result >= 0) {
      result =
          ::sd_bus_emit_signal(bus, "/com/kestrel/notify", "com.kestrel.Notify", "Posted", "s", name.c_str());
    }
    if (result >= 0) result = ::sd_bus_flush(bus);
    ::sd_bus_close_unref(bus);
    if (result < 0) logOnce(std::generic_category().message(-result));
  }
};

namespace {

std::string sessionBusAddress() {
  const char* address =
      std::getenv("DBUS_SESSION_BUS_ADDRESS");  // NOLINT(concurrency-mt-unsafe): nobody sets it
  return address == nullptr ? std::string() : address;
}

}  // namespace

HostNotify::HostNotify(HostRuntime& runtime)
    : bus_(std::make_shared<Bus>(runtime.reactor(), sessionBusAddress())),
      queue_(runtime.serialQueue("com.kestrel.sabled.notify", QualityOfService::background)) {}

HostNotify::~HostNotify() = default;

void HostNotify::post(std::string_view name) {
  if (bus_->address.empty()) return bus_->logOnce("there is no session bus");
  queue_->async([bus = bus_, copy = std::string(name)] { bus->emit(copy); });
}

Availability HostNotify::availability() const {
  const bool found = !bus_->address.empty();
  return {"Notify", found, found ? bus_->address : "DBUS_SESSION_BUS_ADDRESS is not set"};
}

}  // namespace sable::platform::host

#pragma once

#include <functional>
#include <memory>
#include <string>

#include "platform/LocationService.h"
#include "platform/host/Descriptor.h"
#include "platform/host/HostRuntime.h"

struct sd_bus;
struct sd_bus_message;

namespace sable::platform::host {

/// One search for the device's location through GeoClue (org.freedesktop.GeoClue2, D-Bus interfaces
/// of version 2) on the system bus, over a connection of its own that ends with the object:
///
///   connect, GetClient --> DesktopId, RequestedAccuracyLevel, Start --> granted | refused | failed
///                          LocationUpdated --> properties of the location --> found
///
/// GeoClue does not tell how it found a location: the type of its fixes is 0. Made and called on one
/// queue, where the events arrive as well; sd-bus is touched nowhere else. Never blocks.
class GeoClueSearch : public std::enable_shared_from_this<GeoClueSearch> {
 public:
  struct Events {
    std::function<void()> granted;
    std::function<void(const LocationFix&)> found;
    // The search is over.
    std::function<void()> refused;
    std::function<void(const std::string& reason)> failed;
  };

  /// A search that looks until it is destroyed, or has found nothing for a minute. Its events come
  /// after start() has returned.
  static std::shared_ptr<GeoClueSearch> start(HostRuntime& runtime, const std::shared_ptr<SerialQueue>& queue,
                                              double desiredAccuracy, Events events);

  /// Use start().
  GeoClueSearch(HostRuntime& runtime, std::shared_ptr<SerialQueue> queue, double desiredAccuracy,
                Events events);
  ~GeoClueSearch();
  GeoClueSearch(const GeoClueSearch&) = delete;
  GeoClueSearch& operator=(const GeoClueSearch&) = delete;

 private:
  using Step = int (GeoClueSearch::*)(sd_bus_message*);

  int connect();
  int watch();
  void serve();
  void end(int error);
  void end(const std::string& reason);

  template <Step step>
  static int arrived(sd_bus_message* message, void* search, void* error);
  template <Step next>
  int get(const char* path, const char* interface, const char* member, const char* argument);

  int gotClient(sd_bus_message* reply);
  int didStart(sd_bus_message* reply);
  int locationUpdated(sd_bus_message* signal);
  int gotLocation(sd_bus_message* reply);

  HostRuntime& runtime_;
  const std::shared_ptr<SerialQueue> queue_;
  const unsigned level_;
  const Events events_;

  sd_bus* bus_ = nullptr;
  Descriptor socket_;  ///< a duplicate: sd-bus closes its own when it likes
  std::unique_ptr<Reactor::Watch> watch_;
  Timer patience_;
  std::string client_;  ///< object path
  bool ended_ = false;
};

}  // namespace sable::platform::host

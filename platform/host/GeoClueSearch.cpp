#include "platform/host/GeoClueSearch.h"

#include <fcntl.h>
#include <systemd/sd-bus.h>

#include <cerrno>
#include <optional>
#include <system_error>
#include <utility>

#include "platform/Subsystem.h"

namespace sable::platform::host {

namespace {

constexpr const char* kService = "org.freedesktop.GeoClue2";
constexpr const char* kManagerPath = "/org/freedesktop/GeoClue2/Manager";
constexpr const char* kManager = "org.freedesktop.GeoClue2.Manager";
constexpr const char* kClient = "org.freedesktop.GeoClue2.Client";
constexpr const char* kLocation = "org.freedesktop.GeoClue2.Location";
constexpr const char* kProperties = "org.freedesktop.DBus.Properties";
constexpr const char* kAccessDenied = "org.freedesktop.DBus.Error.AccessDenied";

/// A device that finds nothing in a minute would only wear its battery down.
constexpr Duration kPatience = std::chrono::minutes(1);

// GClueAccuracyLevel
constexpr unsigned kCity = 4, kExact = 8;

unsigned accuracyLevel(double desiredAccuracy) {
  constexpr double kCitySuffices = 5000;  // metres
  return desiredAccuracy >= kCitySuffices ? kCity : kExact;
}

int readDouble(sd_bus_message* message, std::optional<double>& number) {
  return sd_bus_message_read(message, "v", "d", &number.emplace());
}

int readTime(sd_bus_message* message, WallTime& time) {
  std::uint64_t seconds = 0, microseconds = 0;
  const int result = sd_bus_message_read(message, "v", "(tt)", &seconds, &microseconds);
  if (result >= 0) {
    time =
        wallTimeFromSecondsSince1970(static_cast<double>(seconds) + static_cast<double>(microseconds) / 1e6);
  }
  return result;
}

}  // namespace

std::shared_ptr<GeoClueSearch> GeoClueSearch::start(HostRuntime& runtime,
                                                    const std::shared_ptr<SerialQueue>& queue,
                                                    double desiredAccuracy, Events events) {
  auto search = std::make_shared<GeoClueSearch>(runtime, queue, desiredAccuracy, std::move(events));
  queue->async([weak = std::weak_ptr(search)] {
    const auto self = weak.lock();
    if (self == nullptr) return;
    if (const int error = self->connect(); error < 0) self->end(error);
  });
  return search;
}

GeoClueSearch::GeoClueSearch(HostRuntime& runtime, std::shared_ptr<SerialQueue> queue, double desiredAccuracy,
                             Events events)
    : runtime_(runtime),
      queue_(std::move(queue)),
      level_(accuracyLevel(desiredAccuracy)),
      events_(std::move(events)) {}

GeoClueSearch::~GeoClueSearch() {
  watch_.reset();
  if (bus_ == nullptr) return;
  // GeoClue stops by itself when the connection ends, but only once it has noticed.
  if (!client_.empty()) {
    sd_bus_call_method_async(bus_, nullptr, kService, client_.c_str(), kClient, "Stop", nullptr, nullptr, "");
  }
  sd_bus_close_unref(bus_);
}

int GeoClueSearch::connect() {
  int result = sd_bus_open_system(&bus_);
  if (result >= 0) result = get<&GeoClueSearch::gotClient>(kManagerPath, kManager, "GetClient", nullptr);
  if (result >= 0) result = watch();
  return result;
}

int GeoClueSearch::watch() {
  socket_ = Descriptor(::fcntl(sd_bus_get_fd(bus_), F_DUPFD_CLOEXEC, 3));
  if (!socket_) return -errno;
  watch_ =
      runtime_.reactor().watch(socket_.number(), [weak = weak_from_this(), queue = queue_](host::Events) {
        queue->async([weak] {
          if (const auto self = weak.lock()) self->serve();
        });
      });
  patience_ = queue_->after(kPatience, [weak = weak_from_this()] {
    if (const auto self = weak.lock()) self->end("GeoClue has found nothing in a minute");
  });
  watch_->arm(static_cast<host::Events>(sd_bus_get_events(bus_)));
  return 0;
}

void GeoClueSearch::serve() {
  int result = 1;
  while (result > 0 && !ended_) result = sd_bus_process(bus_, nullptr);
  if (ended_) return;
  if (result >= 0 && sd_bus_is_open(bus_) <= 0) result = -ECONNRESET;
  const int events = result < 0 ? result : sd_bus_get_events(bus_);
  if (events < 0) return end(events);
  watch_->arm(static_cast<host::Events>(events));
}

void GeoClueSearch::end(int error) {
  end("GeoClue: " + std::generic_category().message(-error));
}

void GeoClueSearch::end(const std::string& reason) {
  if (!std::exchange(ended_, true)) events_.failed(reason);
}

/// What sd-bus calls with a reply or a signal.
template <GeoClueSearch::Step step>
int GeoClueSearch::arrived(sd_bus_message* message, void* search, void* /*error*/) {
  auto& self = *static_cast<GeoClueSearch*>(search);
  if (self.ended_) return 0;
  const sd_bus_error* error = sd_bus_message_get_error(message);
  if (error != nullptr && sd_bus_error_has_name(error, kAccessDenied) != 0) {
    self.ended_ = true;
    self.events_.refused();
  } else if (error != nullptr) {
    self.end(std::string("GeoClue: ") + error->name);
  } else if (const int result = (self.*step)(message); result < 0) {
    self.end(result);
  }
  return 0;
}

/// Calls a method with one string or, for a null one, with nothing; `next` gets the reply.
template <GeoClueSearch::Step next>
int GeoClueSearch::get(const char* path, const char* interface, const char* member, const char* argument) {
  const sd_bus_message_handler_t handler = [](sd_bus_message* message, void* search, sd_bus_error* error) {
    return arrived<next>(message, search, error);
  };
  return argument == nullptr
             ? sd_bus_call_method_async(bus_, nullptr, kService, path, interface, member, handler, this, "")
             : sd_bus_call_method_async(bus_, nullptr, kService, path, interface, member, handler, this, "s",
                                        argument);
}

int GeoClueSearch::gotClient(sd_bus_message* reply) {
  const char* path = nullptr;
  if (const int result = sd_bus_message_read(reply, "o", &path); result < 0) return result;
  client_ = path;
  // By its unique name, which is what the signal will carry.
  int result = sd_bus_match_signal_async(
      bus_, nullptr, sd_bus_message_get_sender(reply), path, kClient, "LocationUpdated",
      [](sd_bus_message* signal, void* search, sd_bus_error* error) {
        return arrived<&GeoClueSearch::locationUpdated>(signal, search, error);
      },
      nullptr, this);
  const std::string name(kSubsystem);
  if (result >= 0) {
    result = sd_bus_call_method_async(bus_, nullptr, kService, path, kProperties, "Set", nullptr, nullptr,
                                      "ssv", kClient, "DesktopId", "s", name.c_str());
  }
  if (result >= 0) {
    result = sd_bus_call_method_async(bus_, nullptr, kService, path, kProperties, "Set", nullptr, nullptr,
                                      "ssv", kClient, "RequestedAccuracyLevel", "u", level_);
  }
  if (result >= 0) result = get<&GeoClueSearch::didStart>(path, kClient, "Start", nullptr);
  return result;
}

int GeoClueSearch::didStart(sd_bus_message* /*reply*/) {
  events_.granted();
  return 0;
}

int GeoClueSearch::locationUpdated(sd_bus_message* signal) {
  const char *before = nullptr, *now = nullptr;
  const int result = sd_bus_message_read(signal, "oo", &before, &now);
  if (result < 0) return result;
  return get<&GeoClueSearch::gotLocation>(now, kProperties, "GetAll", kLocation);
}

int GeoClueSearch::gotLocation(sd_bus_message* reply) {
  std::optional<double> latitude, longitude;
  WallTime timestamp = runtime_.now();
  int result = sd_bus_message_enter_container(reply, 'a', "{sv}");
  while (result >= 0 && (result = sd_bus_message_enter_container(reply, 'e', "sv")) > 0) {
    const char* text = nullptr;
    result = sd_bus_message_read(reply, "s", &text);
    const std::string_view name = result < 0 ? "" : text;
    if (result >= 0) {
      result = name == "Latitude"    ? readDouble(reply, latitude)
               : name == "Longitude" ? readDouble(reply, longitude)
               : name == "Timestamp" ? readTime(reply, timestamp)
                                     : sd_bus_message_skip(reply, "v");
    }
    if (result >= 0) result = sd_bus_message_exit_container(reply);
  }
  if (result < 0) return result;
  if (!latitude || !longitude) return -EBADMSG;
  events_.found({*latitude, *longitude, 0, timestamp});
  return 0;
}

}  // namespace sable::platform::host

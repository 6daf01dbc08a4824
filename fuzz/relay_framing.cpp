#include <sys/socket.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "platform/host/RelayFraming.h"

namespace {

using namespace std::string_view_literals;

void require(bool condition) {
  if (!condition) std::abort();
}

/// An sd-bus server that has shaken hands.
class Bus {
 public:
  Bus() {
    int ends[2];
    require(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends) == 0);
    peer_ = ends[0];
    require(sd_bus_new(&bus_) >= 0 && sd_bus_set_fd(bus_, ends[1], ends[1]) >= 0);
    require(sd_bus_set_server(bus_, 1, sd_id128_t{}) >= 0 && sd_bus_start(bus_) >= 0);
    require(sd_bus_add_filter(bus_, nullptr, note, &found_) >= 0);
    const std::string_view handshake = "\0AUTH EXTERNAL\r\nDATA\r\nBEGIN\r\n"sv;
    require(send(peer_, handshake.data(), handshake.size(), 0) == static_cast<ssize_t>(handshake.size()));
    while (sd_bus_is_ready(bus_) == 0) require(sd_bus_process(bus_, nullptr) >= 0);
  }
  ~Bus() {
    sd_bus_close_unref(bus_);
    close(peer_);
  }
  Bus(const Bus&) = delete;
  Bus& operator=(const Bus&) = delete;

  bool finds(std::string_view message) {
    found_ = false;
    require(send(peer_, message.data(), message.size(), 0) == static_cast<ssize_t>(message.size()));
    int result = 1;
    while (!found_ && result > 0) result = sd_bus_process(bus_, nullptr);
    char answer[4096];
    while (recv(peer_, answer, sizeof answer, 0) > 0) continue;
    return found_;
  }

 private:
  static int note(sd_bus_message*, void* found, sd_bus_error*) {
    *static_cast<bool*>(found) = true;
    return 0;
  }

  int peer_ = -1;
  sd_bus* bus_ = nullptr;
  bool found_ = false;
};

}  // namespace

// What passes for a plain call, sd-bus takes for a message.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace sable::platform::host;
  const std::string_view message(reinterpret_cast<const char*>(data), size);
  if (size > 65536 || !isPlainRelayCall(message)) return 0;
  static Bus bus;
  require(bus.finds(message));
  return 0;
}

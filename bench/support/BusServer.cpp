#include <fcntl.h>
#include <fmt/core.h>
#include <poll.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <cstring>
#include <fstream>

#include "bench/support/Bench.h"

namespace sable::bench {
namespace {

constexpr const char* kConfiguration =
    R"(<!DOCTYPE busconfig PUBLIC "-//freedesktop//DTD D-Bus Bus Configuration 1.0//EN"
 "http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd">
<busconfig>
  <type>session</type>
  <listen>unix:path={}</listen>
  <auth>EXTERNAL</auth>
  <policy context="default">
    <allow send_destination="*" eavesdrop="true"/>
    <allow eavesdrop="true"/>
    <allow own="*"/>
  </policy>
</busconfig>
)";

int answer(sd_bus_message* call, void* data, sd_bus_error*) {
  if (sd_bus_message_is_method_call(call, nullptr, "Configure") > 0)
    return sd_bus_reply_method_return(call, "s", "");
  const auto& body = *static_cast<const std::string*>(data);
  sd_bus_message* reply = nullptr;
  sd_bus_message_new_method_return(call, &reply);
  sd_bus_message_append(reply, "t", std::uint64_t{1});
  sd_bus_message_open_container(reply, 'a', "{sv}");
  sd_bus_message_open_container(reply, 'e', "sv");
  sd_bus_message_append(reply, "s", "data");
  sd_bus_message_open_container(reply, 'v', "ay");
  sd_bus_message_append_array(reply, 'y', body.data(), body.size());
  for (int i = 0; i < 3; ++i) sd_bus_message_close_container(reply);
  sd_bus_message_append(reply, "a{sv}", 0);
  sd_bus_send(sd_bus_message_get_bus(call), reply, nullptr);
  sd_bus_message_unref(reply);
  return 1;
}

}  // namespace

BusServer::BusServer(const std::string& folder, std::size_t answerBytes)
    : address_("unix:path=" + folder + "bus") {
  const std::string configuration = folder + "bus.conf";
  std::ofstream(configuration) << fmt::format(kConfiguration, folder + "bus");
  int ready[2];
  if (::pipe(ready) != 0) fail("pipe");
  bus_ = Child([&] {
    const int errors = ::open((folder + "bus.err").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
    ::dup2(errors, STDERR_FILENO);
    const std::string print = fmt::format("--print-address={}", ready[1]);
    ::execlp("dbus-daemon", "dbus-daemon", ("--config-file=" + configuration).c_str(), "--nofork",
             print.c_str(), nullptr);
  });
  awaitLine(ready[0]);
  server_ = Child([&] { serve(std::string(answerBytes, 'x'), ready[1]); });
  awaitLine(ready[0]);
  ::close(ready[0]);
  ::close(ready[1]);
}

void BusServer::awaitLine(int descriptor) {
  for (char c = 0; c != '\n';) {
    pollfd waiting{descriptor, POLLIN, 0};
    if (::poll(&waiting, 1, 10'000) != 1 || ::read(descriptor, &c, 1) != 1) fail("no message bus");
  }
}

void BusServer::serve(std::string body, int ready) const {
  sd_bus* bus = nullptr;
  sd_bus_new(&bus);
  sd_bus_set_address(bus, address_.c_str());
  sd_bus_set_bus_client(bus, 1);
  if (sd_bus_start(bus) < 0 || sd_bus_request_name(bus, kName, 0) < 0) fail("the rival cannot join its bus");
  sd_bus_add_object(bus, nullptr, "/com/kestrel/sabled", answer, &body);
  if (::write(ready, "\n", 1) != 1) fail("pipe");
  for (;;) {
    while (sd_bus_process(bus, nullptr) > 0) continue;
    if (sd_bus_wait(bus, UINT64_MAX) < 0) return;
  }
}

}  // namespace sable::bench

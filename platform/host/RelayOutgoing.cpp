#include "platform/host/RelayOutgoing.h"

#include <systemd/sd-bus.h>

namespace sable::platform::host {

namespace {

/// A call that only carries the cookie to be answered, so that the real one need not be kept, with
/// its descriptors, until the answer is there.
int makeTicket(sd_bus* bus, std::uint64_t cookie, RelayMessage& ticket) {
  sd_bus_message* made = nullptr;
  const int error = sd_bus_message_new(bus, &made, SD_BUS_MESSAGE_METHOD_CALL);
  if (error < 0) return error;
  ticket.reset(made);
  return sd_bus_message_seal(made, cookie, 0);
}

int makeAnswer(sd_bus* bus, const RelayOutgoing& outgoing, RelayMessage& message) {
  RelayMessage ticket;
  int error = makeTicket(bus, outgoing.cookie, ticket);
  if (error < 0) return error;
  sd_bus_message* made = nullptr;
  if (outgoing.kind == RelayOutgoing::Kind::reply) {
    error = sd_bus_message_new_method_return(ticket.get(), &made);
  } else {
    const sd_bus_error described =
        SD_BUS_ERROR_MAKE_CONST(outgoing.errorName.c_str(), outgoing.errorText.c_str());
    error = sd_bus_message_new_method_error(ticket.get(), &made, &described);
  }
  message.reset(made);
  return error;
}

int makeCall(sd_bus* bus, const RelayOutgoing& outgoing, RelayMessage& message) {
  sd_bus_message* made = nullptr;
  int error = sd_bus_message_new_method_call(
      bus, &made, nullptr, std::string(outgoing.interface->path).c_str(),
      std::string(outgoing.interface->name).c_str(), std::string(outgoing.method->name).c_str());
  if (error < 0) return error;
  message.reset(made);
  return sd_bus_message_set_expect_reply(made, outgoing.kind == RelayOutgoing::Kind::call);
}

}  // namespace

int makeMessage(sd_bus* bus, const RelayOutgoing& outgoing, RelayMessage& message) {
  const bool calls =
      outgoing.kind == RelayOutgoing::Kind::call || outgoing.kind == RelayOutgoing::Kind::oneWay;
  int error = calls ? makeCall(bus, outgoing, message) : makeAnswer(bus, outgoing, message);
  if (error >= 0) error = appendArguments(message.get(), outgoing.arguments);
  if (error >= 0 && calls) error = sd_bus_message_seal(message.get(), outgoing.cookie, 0);
  return error;
}

}  // namespace sable::platform::host

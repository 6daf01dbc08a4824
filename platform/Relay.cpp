#include "platform/Relay.h"

namespace sable::platform {

namespace {

void failDropped(RelayReply::Implementation* implementation) {
  if (implementation != nullptr) {
    implementation->fail("org.freedesktop.DBus.Error.NoReply", "The call was dropped unanswered");
  }
}

}  // namespace

RelayReply::RelayReply(std::unique_ptr<Implementation> implementation)
    : implementation_(std::move(implementation)) {}

RelayReply& RelayReply::operator=(RelayReply&& other) noexcept {
  if (this != &other) {
    const auto dropped = std::exchange(implementation_, std::move(other.implementation_));
    failDropped(dropped.get());
  }
  return *this;
}

RelayReply::~RelayReply() {
  failDropped(implementation_.get());
}

void RelayReply::send(RelayArguments arguments) {
  if (const auto implementation = std::exchange(implementation_, nullptr)) {
    implementation->send(std::move(arguments));
  }
}

void RelayReply::fail(std::string_view name, std::string_view message) {
  if (const auto implementation = std::exchange(implementation_, nullptr)) {
    implementation->fail(name, message);
  }
}

void RelayReply::forget() {
  if (const auto implementation = std::exchange(implementation_, nullptr)) implementation->forget();
}

}  // namespace sable::platform

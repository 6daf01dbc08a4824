#pragma once

#include <cstddef>
#include <string>
#include <string_view>

#include "platform/host/Descriptor.h"

namespace sable::platform::host {

/// What a stranger says, on its way to sd-bus.
///
/// sd-bus leaves out a message whose head breaks the rules without a word, with the descriptors that came
/// with it open, and lets a message grow to 128 MiB. So its descriptor is the stranger's socket only while
/// nothing but whole plain calls lie at the socket's head: a look is a fifth of the price of copying them.
/// Everything else (handshake, large messages, parts of messages, whatever is odd) is read here, where the
/// kernel closes the descriptors that come with it, and reaches sd-bus through a socket pair.
/// Either way it is known how many messages sd-bus must find; when it finds fewer, one of them was none.
class RelayInlet {
 public:
  /// The socket stays the caller's.
  RelayInlet(int socket, std::size_t messageBytes) : socket_(socket), messageBytes_(messageBytes) {}

  /// The descriptor for sd-bus, which owns it from now on; below 0 an errno value.
  [[nodiscard]] int start();

  /// Lets sd-bus read on, which must have read all that it was let. Adds to `messages` those whose end it
  /// will find. 0: there is nothing to read before the socket is readable again, and sd-bus must not try
  /// unless after detach(); -ECONNRESET: the peer left; -EBADMSG: that is no message; -EMSGSIZE: it is too
  /// large; -EOPNOTSUPP: descriptors came with it.
  [[nodiscard]] int admit(std::size_t& messages);

  /// Whether sd-bus reads the socket itself: then it must stop at the last of the messages.
  bool isAttached() const { return !toBus_; }
  /// Whether the handshake's last line was admitted.
  bool hasBegun() const { return begun_; }

  /// Keeps sd-bus from the socket, so that it may write without reading what nobody has looked at.
  [[nodiscard]] int detach();

 private:
  int receive(char* bytes, std::size_t size, int flags) const;
  int look(std::size_t& messages);
  int feed(std::size_t& messages);
  int count(std::string_view bytes, std::size_t& messages);
  bool countLine(std::string_view& bytes);

  const int socket_;
  const std::size_t messageBytes_;
  int input_ = -1;    // sd-bus's
  Descriptor toBus_;  // the other end of the pair, while sd-bus reads from that

  // Where the stream is that sd-bus was let read.
  bool begun_ = false;  // behind the handshake
  std::string line_;    // of the handshake, that has not come whole
  std::string fixed_;   // bytes of a message's fixed part that has not come whole
  std::size_t messageLeft_ = 0;
};

}  // namespace sable::platform::host

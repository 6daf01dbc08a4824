#include "tests/support/RawPeer.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <stdexcept>

namespace sable::test {

WireBytes& WireBytes::align(std::size_t to) {
  bytes_.resize((bytes_.size() + to - 1) / to * to);
  return *this;
}

WireBytes& WireBytes::byte(unsigned value) {
  bytes_ += static_cast<char>(value);
  return *this;
}

WireBytes& WireBytes::word(std::uint32_t value) {
  align(4);
  for (int shift = 0; shift < 32; shift += 8) byte(value >> shift & 0xff);
  return *this;
}

WireBytes& WireBytes::string(std::string_view text) {
  return word(static_cast<std::uint32_t>(text.size())).raw(text).byte(0);
}

WireBytes& WireBytes::signature(std::string_view text) {
  return byte(static_cast<unsigned>(text.size())).raw(text).byte(0);
}

WireBytes& WireBytes::raw(std::string_view bytes) {
  bytes_ += bytes;
  return *this;
}

std::string WireCall::record(std::initializer_list<std::pair<std::string_view, std::string_view>> members) {
  WireBytes entries;
  for (const auto& [name, value] : members) entries.align(8).string(name).signature("s").string(value);
  return WireBytes().word(static_cast<std::uint32_t>(entries.size())).align(8).raw(entries.bytes()).bytes();
}

std::string WireCall::bytes() const {
  WireBytes fields;
  fields.byte(1).signature("o").string(path);
  fields.align(8).byte(2).signature("s").string(interface);
  fields.align(8).byte(3).signature("s").string(member);
  if (!signature.empty()) fields.align(8).byte(8).signature("g").signature(signature);
  if (descriptors > 0) fields.align(8).byte(9).signature("u").word(descriptors);
  const auto length = bodyLength > 0 ? bodyLength : static_cast<std::uint32_t>(body.size());
  WireBytes message;
  message.byte(static_cast<unsigned char>(endianness)).byte(type).byte(0).byte(version);
  message.word(length).word(1).word(static_cast<std::uint32_t>(fields.size()));
  return message.raw(fields.bytes()).align(8).raw(body).bytes();
}

RawPeer::RawPeer(const std::string& path) : socket_(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  path.copy(address.sun_path, sizeof address.sun_path - 1);
  if (connect(socket_, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
    throw std::runtime_error("cannot connect to " + path);
  }
}

RawPeer::~RawPeer() {
  close(socket_);
}

void RawPeer::authenticate() {
  using namespace std::string_view_literals;
  send("\0AUTH EXTERNAL\r\nDATA\r\nNEGOTIATE_UNIX_FD\r\n"sv);
  for (std::string said; said.find("AGREE_UNIX_FD\r\n") == std::string::npos;) {
    const std::string more = receive();
    if (more == "hung up") throw std::runtime_error("refused: " + said);
    said += more;
  }
  send("BEGIN\r\n");
}

bool RawPeer::send(std::string_view bytes, int descriptor) const {
  alignas(cmsghdr) char control[CMSG_SPACE(sizeof descriptor)] = {};
  for (bool first = true; !bytes.empty(); first = false) {
    iovec part{const_cast<char*>(bytes.data()), bytes.size()};
    msghdr message{};
    message.msg_iov = &part;
    message.msg_iovlen = 1;
    if (descriptor >= 0 && first) {
      message.msg_control = control;
      message.msg_controllen = sizeof control;
      cmsghdr* header = CMSG_FIRSTHDR(&message);
      header->cmsg_level = SOL_SOCKET;
      header->cmsg_type = SCM_RIGHTS;
      header->cmsg_len = CMSG_LEN(sizeof descriptor);
      std::memcpy(CMSG_DATA(header), &descriptor, sizeof descriptor);
    }
    const ssize_t count = sendmsg(socket_, &message, MSG_NOSIGNAL);
    if (count < 0) return false;
    bytes.remove_prefix(static_cast<std::size_t>(count));
  }
  return true;
}

std::string RawPeer::receive() const {
  constexpr int kPatienceMilliseconds = 30'000;
  pollfd descriptor{socket_, POLLIN, 0};
  if (poll(&descriptor, 1, kPatienceMilliseconds) <= 0) return "silence";
  char bytes[65536];
  const ssize_t count = recv(socket_, bytes, sizeof bytes, 0);
  return count <= 0 ? "hung up" : std::string(bytes, static_cast<std::size_t>(count));
}

}  // namespace sable::test

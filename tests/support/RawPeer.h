#pragma once

#include <cstdint>
#include <initializer_list>
#include <string>
#include <string_view>
#include <utility>

namespace sable::test {

/// D-Bus's wire format, little endian, right or wrong (D-Bus specification, "Marshaling").
class WireBytes {
 public:
  WireBytes& align(std::size_t to);
  WireBytes& byte(unsigned value);
  WireBytes& word(std::uint32_t value);
  WireBytes& string(std::string_view text);
  WireBytes& signature(std::string_view text);
  WireBytes& raw(std::string_view bytes);
  std::size_t size() const { return bytes_.size(); }
  const std::string& bytes() const { return bytes_; }

 private:
  std::string bytes_;
};

/// A call of SBLDaemonRelay, in parts that a test may spoil.
struct WireCall {
  std::string path = "/com/kestrel/sabled", interface = "com.kestrel.SBLDaemonRelay", member = "Configure";
  std::string signature = "a{sv}", body = {};
  char endianness = 'l';
  unsigned type = 1, version = 1;
  std::uint32_t bodyLength = 0;  ///< 0: what it is
  std::uint32_t descriptors = 0;

  std::string bytes() const;
  /// An a{sv} of strings.
  static std::string record(std::initializer_list<std::pair<std::string_view, std::string_view>> members);
};

/// A client that says any bytes to a Unix socket.
class RawPeer {
 public:
  explicit RawPeer(const std::string& path);
  ~RawPeer();
  RawPeer(const RawPeer&) = delete;
  RawPeer& operator=(const RawPeer&) = delete;

  /// Shakes hands as this user, with descriptors allowed.
  void authenticate();
  /// Whether the bytes could be sent; `descriptor`, when there is one, goes with them.
  bool send(std::string_view bytes, int descriptor = -1) const;
  /// Waits for what the peer says next: "hung up", or its bytes.
  std::string receive() const;

 private:
  int socket_;
};

}  // namespace sable::test

#pragma once

#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/Relay.h"

namespace sable::platform::host {

/// What a connection offers to its peer: the exported interfaces, and on every object what any
/// D-Bus client may ask (Introspectable, Properties, and Hello, without which busctl and gdbus do
/// not talk to a peer). Peer is answered by sd-bus.
class RelayObjects {
 public:
  /// The head of a call.
  struct Header {
    std::string_view path;
    std::string_view interface;  ///< may be absent: then the member decides
    std::string_view member;
    std::string_view signature;
    std::string_view argument;  ///< the first argument of a call to Properties
  };

  /// A call of an exported method.
  struct Target {
    std::size_t exported;  ///< in order of add()
    std::size_t method;
    const RelayMethod* description;
  };
  struct Refusal {
    std::string name;
    std::string text;
  };
  using Resolution = std::variant<Target, RelayArguments, Refusal>;

  /// `uniqueName` is what Hello answers.
  explicit RelayObjects(std::string uniqueName) : uniqueName_(std::move(uniqueName)) {}

  void add(const RelayInterface& interface) { exported_.push_back(&interface); }

  /// The method that is called, or the answer to a standard call, or the error to answer with.
  Resolution resolve(const Header& call) const;

 private:
  bool exists(std::string_view path) const;
  bool offers(std::string_view path, std::string_view interface) const;
  Resolution standard(const Header& call) const;
  Resolution properties(const Header& call) const;
  Refusal unknown(const Header& call) const;
  std::string introspection(std::string_view path) const;

  const std::string uniqueName_;
  std::vector<const RelayInterface*> exported_;
};

}  // namespace sable::platform::host

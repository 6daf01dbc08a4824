#include "platform/host/RelayObjects.h"

#include <fmt/format.h>

#include <algorithm>
#include <set>

#include "platform/RelaySupport.h"

namespace sable::platform::host {

namespace {

constexpr std::string_view kBusPath = "/org/freedesktop/DBus";
constexpr std::string_view kBus = "org.freedesktop.DBus";
constexpr std::string_view kIntrospectable = "org.freedesktop.DBus.Introspectable";
constexpr std::string_view kPeer = "org.freedesktop.DBus.Peer";
constexpr std::string_view kProperties = "org.freedesktop.DBus.Properties";

constexpr RelayMethod kIntrospectableMethods[] = {{"Introspect", "", "s"}};
constexpr RelayMethod kPeerMethods[] = {{"Ping", "", ""}, {"GetMachineId", "", "s"}};
// Signatures of Properties hold variants, which no value of ours has.
constexpr RelayMethod kPropertiesMethods[] = {
    {"Get", "ss", "v"}, {"GetAll", "s", "a{sv}"}, {"Set", "ssv", ""}};
constexpr RelayMethod kBusMethods[] = {{"Hello", "", "s"}};

constexpr RelayInterface kStandard[] = {{kPeer, "", kPeerMethods},
                                        {kIntrospectable, "", kIntrospectableMethods},
                                        {kProperties, "", kPropertiesMethods}};

RelayObjects::Refusal error(std::string_view name, std::string text) {
  return {fmt::format("org.freedesktop.DBus.Error.{}", name), std::move(text)};
}

RelayObjects::Refusal wrongArguments(const RelayMethod& method, std::string_view given) {
  return error("InvalidArgs", fmt::format("{} takes \"{}\", not \"{}\"", method.name, method.in, given));
}

const RelayMethod* methodNamed(std::span<const RelayMethod> methods, std::string_view name) {
  const auto found = std::ranges::find(methods, name, &RelayMethod::name);
  return found == methods.end() ? nullptr : &*found;
}

bool mayMean(const RelayObjects::Header& call, std::string_view interface) {
  return call.interface.empty() || call.interface == interface;
}

/// The complete type at the head of `signature`, which loses it.
std::string_view takeType(std::string_view& signature) {
  std::string_view rest = signature;
  if (!takeRelayType(rest)) rest.remove_prefix(1);
  const std::string_view type = signature.substr(0, signature.size() - rest.size());
  signature = rest;
  return type;
}

void describe(std::string& xml, std::string_view signature, std::string_view direction) {
  while (!signature.empty()) {
    fmt::format_to(std::back_inserter(xml), "   <arg type=\"{}\" direction=\"{}\"/>\n", takeType(signature),
                   direction);
  }
}

void describe(std::string& xml, const RelayInterface& interface) {
  fmt::format_to(std::back_inserter(xml), " <interface name=\"{}\">\n", interface.name);
  for (const RelayMethod& method : interface.methods) {
    fmt::format_to(std::back_inserter(xml), "  <method name=\"{}\">\n", method.name);
    describe(xml, method.in, "in");
    describe(xml, method.out, "out");
    xml += "  </method>\n";
  }
  xml += " </interface>\n";
}

/// The name of the child of `parent` that leads to `path`; empty when none does.
std::string_view childTowards(std::string_view path, std::string_view parent) {
  if (parent == "/") parent = "";
  if (!path.starts_with(parent) || path.size() <= parent.size() + 1 || path[parent.size()] != '/') return {};
  path.remove_prefix(parent.size() + 1);
  return path.substr(0, path.find('/'));
}

}  // namespace

RelayObjects::Resolution RelayObjects::resolve(const Header& call) const {
  for (std::size_t i = 0; i < exported_.size(); ++i) {
    const RelayInterface& interface = *exported_[i];
    if (interface.path != call.path || !mayMean(call, interface.name)) continue;
    const RelayMethod* method = methodNamed(interface.methods, call.member);
    if (method == nullptr) continue;
    if (method->in != call.signature) return wrongArguments(*method, call.signature);
    return Target{i, static_cast<std::size_t>(method - interface.methods.data()), method};
  }
  return standard(call);
}

RelayObjects::Resolution RelayObjects::standard(const Header& call) const {
  if (!exists(call.path)) return unknown(call);
  if (call.path == kBusPath && mayMean(call, kBus) && call.member == "Hello") {
    if (!call.signature.empty()) return wrongArguments(kBusMethods[0], call.signature);
    return RelayArguments{uniqueName_};
  }
  if (mayMean(call, kIntrospectable) && call.member == "Introspect") {
    if (!call.signature.empty()) return wrongArguments(kIntrospectableMethods[0], call.signature);
    return RelayArguments{introspection(call.path)};
  }
  if (mayMean(call, kPeer) && call.member == "Ping") return RelayArguments{};
  if (call.interface == kProperties) return properties(call);
  return unknown(call);
}

RelayObjects::Resolution RelayObjects::properties(const Header& call) const {
  const RelayMethod* method = methodNamed(kPropertiesMethods, call.member);
  if (method == nullptr) return unknown(call);
  if (call.signature != method->in) return wrongArguments(*method, call.signature);
  if (!offers(call.path, call.argument)) {
    return error("UnknownInterface", fmt::format("{} has no interface {}", call.path, call.argument));
  }
  if (method->name == "GetAll") return RelayArguments{RelayRecord()};
  return error("UnknownProperty", fmt::format("{} has no properties", call.argument));
}

RelayObjects::Refusal RelayObjects::unknown(const Header& call) const {
  if (!exists(call.path)) return error("UnknownObject", fmt::format("There is no object {}", call.path));
  if (!call.interface.empty() && !offers(call.path, call.interface)) {
    return error("UnknownInterface", fmt::format("{} has no interface {}", call.path, call.interface));
  }
  return error("UnknownMethod", fmt::format("{} has no method {}", call.path, call.member));
}

bool RelayObjects::exists(std::string_view path) const {
  const auto leadsTo = [path](std::string_view exported) {
    return exported == path || !childTowards(exported, path).empty();
  };
  return leadsTo(kBusPath) || std::ranges::any_of(exported_, leadsTo, &RelayInterface::path);
}

bool RelayObjects::offers(std::string_view path, std::string_view interface) const {
  if (path == kBusPath && interface == kBus) return true;
  if (std::ranges::find(kStandard, interface, &RelayInterface::name) != std::end(kStandard)) return true;
  return std::ranges::any_of(exported_, [&](const RelayInterface* exported) {
    return exported->path == path && exported->name == interface;
  });
}

std::string RelayObjects::introspection(std::string_view path) const {
  std::string xml =
      "<!DOCTYPE node PUBLIC \"-//freedesktop//DTD D-BUS Object Introspection 1.0//EN\"\n"
      "\"http://www.freedesktop.org/standards/dbus/1.0/introspect.dtd\">\n<node>\n";
  for (const RelayInterface& interface : kStandard) describe(xml, interface);
  std::set<std::string_view> children;
  for (const RelayInterface* interface : exported_) {
    if (interface->path == path) describe(xml, *interface);
    if (const auto child = childTowards(interface->path, path); !child.empty()) children.insert(child);
  }
  for (const std::string_view child : children) {
    fmt::format_to(std::back_inserter(xml), " <node name=\"{}\"/>\n", child);
  }
  return xml + "</node>\n";
}

}  // namespace sable::platform::host

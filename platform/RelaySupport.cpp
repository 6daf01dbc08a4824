#include "platform/RelaySupport.h"

#include <fmt/core.h>

#include <array>

#include "platform/ProgrammingError.h"

namespace sable::platform {

namespace {

constexpr std::array<std::string_view, std::variant_size_v<RelayValue::variant>> kTypes = {
    "", "b", "x", "t", "d", "s", "ay", "as", "a{sv}", "aa{sv}", "a(ss)", "a{ss}", "a{say}", "ah"};

constexpr std::size_t kHeaderSize = 128;
constexpr std::size_t kItemOverhead = 8;  // length, padding, terminator

std::size_t sizeOf(const RelayValue& value);

std::size_t sizeOf(const RelayRecord& record) {
  std::size_t size = kItemOverhead;
  for (const RelayMember& member : record.members()) {
    size += 2 * kItemOverhead + member.name.size() + sizeOf(member.value);
  }
  return size;
}

std::size_t sizeOf(const std::vector<std::pair<std::string, std::string>>& pairs) {
  std::size_t size = kItemOverhead;
  for (const auto& [name, value] : pairs) size += 2 * kItemOverhead + name.size() + value.size();
  return size;
}

struct SizeOf {
  template <class Plain>
  std::size_t operator()(const Plain&) const {
    return kItemOverhead;
  }
  std::size_t operator()(const std::string& text) const { return kItemOverhead + text.size(); }
  std::size_t operator()(const Data& data) const { return kItemOverhead + (data ? data->size() : 0); }
  std::size_t operator()(const RelayStrings& strings) const {
    std::size_t size = kItemOverhead;
    for (const std::string& text : strings) size += kItemOverhead + text.size();
    return size;
  }
  std::size_t operator()(const RelayRecord& record) const { return sizeOf(record); }
  std::size_t operator()(const RelayRecords& records) const {
    std::size_t size = kItemOverhead;
    for (const RelayRecord& record : records) size += sizeOf(record);
    return size;
  }
  std::size_t operator()(const RelayStringPairs& pairs) const { return sizeOf(pairs.pairs); }
  std::size_t operator()(const RelayStringMap& map) const { return sizeOf(map.entries); }
  std::size_t operator()(const RelayDataMap& map) const {
    std::size_t size = kItemOverhead;
    for (const auto& [name, data] : map.entries) size += kItemOverhead + name.size() + (*this)(data);
    return size;
  }
};

std::size_t sizeOf(const RelayValue& value) {
  return std::visit(SizeOf{}, value);
}

}  // namespace

std::string_view RelayValue::signature() const {
  return kTypes[index()];
}

std::optional<std::size_t> takeRelayType(std::string_view& signature) {
  for (std::size_t i = 1; i < kTypes.size(); ++i) {
    if (signature.starts_with(kTypes[i])) {
      signature.remove_prefix(kTypes[i].size());
      return i;
    }
  }
  return std::nullopt;
}

std::string relaySignature(const RelayArguments& arguments) {
  std::string signature;
  for (const RelayValue& argument : arguments) signature += argument.signature();
  return signature;
}

bool relayArgumentsMatch(const RelayArguments& arguments, std::string_view signature) {
  for (const RelayValue& argument : arguments) {
    const std::string_view type = argument.signature();
    if (type.empty() || !signature.starts_with(type)) return false;
    signature.remove_prefix(type.size());
  }
  return signature.empty();
}

void requireRelaySignature(const RelayArguments& arguments, std::string_view signature,
                           std::string_view method) {
  if (relayArgumentsMatch(arguments, signature)) return;
  programmingError(
      fmt::format("{} has \"{}\" but was given \"{}\"", method, signature, relaySignature(arguments)));
}

std::size_t relayWireSize(const RelayArguments& arguments) {
  std::size_t size = kHeaderSize;
  for (const RelayValue& argument : arguments) size += sizeOf(argument);
  return size;
}

bool isAbsent(const RelayValue& value) {
  const Data* data = std::get_if<Data>(&value);
  return std::holds_alternative<std::monostate>(value) || (data != nullptr && *data == nullptr);
}

tl::unexpected<Error> relayError(RelayErrorCode code, std::string reason) {
  return tl::unexpected(
      Error{std::string(kRelayErrorDomain), static_cast<std::int64_t>(code), std::move(reason)});
}

tl::unexpected<Error> relayDisconnected() {
  return relayError(RelayErrorCode::disconnected, "The connection has ended");
}

tl::unexpected<Error> relayTimedOut() {
  return relayError(RelayErrorCode::timedOut, "No answer came in time");
}

}  // namespace sable::platform

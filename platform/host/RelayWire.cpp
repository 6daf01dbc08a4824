#include "platform/host/RelayWire.h"

#include <fcntl.h>
#include <systemd/sd-bus.h>
#include <unicode/unistr.h>
#include <unicode/ustring.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "platform/RelaySupport.h"
#include "platform/host/Descriptor.h"

namespace sable::platform::host {

namespace {

bool isPlainASCII(std::string_view text) {
  constexpr std::uint64_t kHighBits = 0x8080808080808080;
  std::uint64_t seen = 0;
  while (text.size() >= sizeof seen) {
    std::uint64_t word = 0;
    std::memcpy(&word, text.data(), sizeof word);
    seen |= word;
    text.remove_prefix(sizeof word);
  }
  for (const char byte : text) seen |= static_cast<unsigned char>(byte);
  return (seen & kHighBits) == 0;
}

bool isUTF8(const std::string& text) {
  UErrorCode status = U_ZERO_ERROR;
  int32_t length = 0;
  u_strFromUTF8(nullptr, 0, &length, text.data(), static_cast<int32_t>(text.size()), &status);
  return status == U_BUFFER_OVERFLOW_ERROR || U_SUCCESS(status);
}

bool isWireText(const std::string& text) {
  if (text.find('\0') != std::string::npos) return false;
  return isPlainASCII(text) || isUTF8(text);
}

std::string wireText(const std::string& text) {
  auto points = icu::UnicodeString::fromUTF8(text);
  points.findAndReplace(icu::UnicodeString(UChar32{0}), icu::UnicodeString(UChar32{0xFFFD}));
  std::string mended;
  return points.toUTF8String(mended);
}

/// Appends values; after the first failure nothing more is tried.
class Writer {
 public:
  explicit Writer(sd_bus_message* message) : message_(message) {}
  int error() const { return error_; }

  void operator()(std::monostate) { fail(EINVAL); }
  void operator()(bool value) {
    const int wide = value ? 1 : 0;
    basic('b', &wide);
  }
  void operator()(std::int64_t value) { basic('x', &value); }
  void operator()(std::uint64_t value) { basic('t', &value); }
  void operator()(double value) { basic('d', &value); }
  void operator()(const std::string& text) {
    basic('s', isWireText(text) ? text.c_str() : wireText(text).c_str());
  }
  void operator()(const Data& data) {
    if (error_ < 0) return;
    error_ = data ? sd_bus_message_append_array(message_, 'y', data->data(), data->size())
                  : sd_bus_message_append_array(message_, 'y', nullptr, 0);
  }
  void operator()(const RelayStrings& strings) {
    open('a', "s");
    for (const std::string& text : strings) (*this)(text);
    close();
  }
  void operator()(const RelayRecord& record) {
    open('a', "{sv}");
    for (const RelayMember& member : record.members()) {
      if (isAbsent(member.value)) continue;
      open('e', "sv");
      (*this)(member.name);
      open('v', member.value.signature().data());
      std::visit(*this, member.value);
      close();
      close();
    }
    close();
  }
  void operator()(const RelayRecords& records) {
    open('a', "a{sv}");
    for (const RelayRecord& record : records) (*this)(record);
    close();
  }
  void operator()(const RelayStringPairs& pairs) {
    open('a', "(ss)");
    for (const auto& [name, value] : pairs.pairs) entry('r', "ss", name, value);
    close();
  }
  void operator()(const RelayStringMap& map) {
    open('a', "{ss}");
    for (const auto& [name, value] : map.entries) entry('e', "ss", name, value);
    close();
  }
  void operator()(const RelayDataMap& map) {
    open('a', "{say}");
    for (const auto& [name, data] : map.entries) entry('e', "say", name, data);
    close();
  }
  void operator()(const RelayFile& file) {
    open('a', "h");
    if (file.descriptor) basic('h', file.descriptor.get());
    close();
  }

 private:
  void fail(int code) {
    if (error_ >= 0) error_ = -code;
  }
  void basic(char type, const void* value) {
    if (error_ >= 0) error_ = sd_bus_message_append_basic(message_, type, value);
  }
  void open(char type, const char* contents) {
    if (error_ >= 0) error_ = sd_bus_message_open_container(message_, type, contents);
  }
  void close() {
    if (error_ >= 0) error_ = sd_bus_message_close_container(message_);
  }
  template <class Value>
  void entry(char type, const char* contents, const std::string& name, const Value& value) {
    open(type, contents);
    (*this)(name);
    (*this)(value);
    close();
  }

  sd_bus_message* message_;
  int error_ = 0;
};

/// What an item costs at least, so that many empty ones are no way around the limit.
constexpr std::size_t kItemBytes = 8;

/// Reads values; after the first failure everything reads as empty.
class Reader {
 public:
  Reader(sd_bus_message* message, std::size_t maximumBytes) : message_(message), bytesLeft_(maximumBytes) {}
  int error() const { return error_; }

  RelayValue value(std::string_view type) {
    switch (*takeRelayType(type)) {
      case 1:
        return basic<int>('b') != 0;
      case 2:
        return basic<std::int64_t>('x');
      case 3:
        return basic<std::uint64_t>('t');
      case 4:
        return basic<double>('d');
      case 5:
        return text();
      case 6:
        return data();
      case 7:
        return strings();
      case 8:
        return record();
      case 9:
        return records();
      case 10:
        return RelayStringPairs{pairs('r')};
      case 11:
        return RelayStringMap{pairs('e')};
      case 12:
        return dataMap();
      default:
        return file();
    }
  }

 private:
  bool good(int result) {
    if (error_ >= 0 && result < 0) error_ = result;
    return result > 0 && error_ >= 0;
  }
  /// Whether there was (another) container to enter.
  bool enter(char type, const char* contents) {
    spend(kItemBytes);
    return error_ >= 0 && good(sd_bus_message_enter_container(message_, type, contents));
  }
  void leave() {
    if (error_ >= 0) good(sd_bus_message_exit_container(message_));
  }
  void spend(std::size_t bytes) {
    if (bytes > bytesLeft_ && error_ >= 0) error_ = -EMSGSIZE;
    bytesLeft_ -= std::min(bytes, bytesLeft_);
  }

  template <class Plain>
  Plain basic(char type) {
    Plain plain{};
    if (error_ >= 0) good(sd_bus_message_read_basic(message_, type, &plain));
    return plain;
  }
  std::string text() {
    const char* read = basic<const char*>('s');
    std::string copied = read == nullptr ? std::string() : std::string(read);
    spend(kItemBytes + copied.size());
    return copied;
  }
  Data data() {
    const void* bytes = nullptr;
    std::size_t size = 0;
    if (error_ >= 0) good(sd_bus_message_read_array(message_, 'y', &bytes, &size));
    spend(size);
    return makeData(size == 0 ? std::string() : std::string(static_cast<const char*>(bytes), size));
  }
  RelayStrings strings() {
    RelayStrings read;
    if (!enter('a', "s")) return read;
    const char* next = nullptr;
    while (error_ >= 0 && good(sd_bus_message_read_basic(message_, 's', &next))) {
      read.emplace_back(next);
      spend(kItemBytes + read.back().size());
    }
    leave();
    return read;
  }
  RelayRecord record() {
    RelayRecord read;
    if (!enter('a', "{sv}")) return read;
    while (enter('e', "sv")) {
      std::string name = text();
      if (RelayValue member = variant(); !isAbsent(member)) read.add(std::move(name), std::move(member));
      leave();
    }
    leave();
    return read;
  }
  RelayValue variant() {
    const char* contents = nullptr;
    if (error_ < 0 || !good(sd_bus_message_peek_type(message_, nullptr, &contents))) return {};
    std::string_view rest = contents;
    const std::string type(rest);
    const bool narrow = type.size() == 1 && std::strchr("ynqiu", type.front()) != nullptr;
    if (!narrow && !(takeRelayType(rest) && rest.empty())) {
      good(sd_bus_message_skip(message_, "v"));
      return {};
    }
    if (!enter('v', type.c_str())) return {};
    RelayValue read = narrow ? narrowInteger(type.front()) : value(type);
    leave();
    return read;
  }
  RelayValue narrowInteger(char type) {
    switch (type) {
      case 'y':
        return std::uint64_t{basic<std::uint8_t>(type)};
      case 'q':
        return std::uint64_t{basic<std::uint16_t>(type)};
      case 'u':
        return std::uint64_t{basic<std::uint32_t>(type)};
      case 'n':
        return std::int64_t{basic<std::int16_t>(type)};
      default:
        return std::int64_t{basic<std::int32_t>(type)};
    }
  }
  RelayRecords records() {
    RelayRecords read;
    if (!enter('a', "a{sv}")) return read;
    while (error_ >= 0 && good(sd_bus_message_at_end(message_, 0) == 0)) read.push_back(record());
    leave();
    return read;
  }
  std::vector<std::pair<std::string, std::string>> pairs(char type) {
    std::vector<std::pair<std::string, std::string>> read;
    if (!enter('a', type == 'r' ? "(ss)" : "{ss}")) return read;
    while (enter(type, "ss")) {
      std::string name = text();
      read.emplace_back(std::move(name), text());
      leave();
    }
    leave();
    return read;
  }
  RelayDataMap dataMap() {
    RelayDataMap read;
    if (!enter('a', "{say}")) return read;
    while (enter('e', "say")) {
      std::string name = text();
      read.entries.emplace_back(std::move(name), data());
      leave();
    }
    leave();
    return read;
  }
  /// The message owns the descriptor it carries: the value gets a copy of its own.
  RelayFile file() {
    RelayFile read;
    if (!enter('a', "h")) return read;
    int carried = -1;
    if (good(sd_bus_message_read_basic(message_, 'h', &carried))) {
      Descriptor own(::fcntl(carried, F_DUPFD_CLOEXEC, 3));
      if (own) {
        read.descriptor = sharedDescriptor(std::move(own));
      } else {
        error_ = -errno;
      }
    }
    leave();
    return read;
  }

  sd_bus_message* message_;
  std::size_t bytesLeft_;
  int error_ = 0;
};

}  // namespace

void ReleaseMessage::operator()(sd_bus_message* message) const {
  sd_bus_message_unref(message);
}

int appendArguments(sd_bus_message* message, const RelayArguments& arguments) {
  Writer writer(message);
  for (const RelayValue& argument : arguments) std::visit(writer, argument);
  return writer.error();
}

int readArguments(sd_bus_message* message, std::string_view signature, std::size_t maximumBytes,
                  RelayArguments& arguments) {
  Reader reader(message, maximumBytes);
  while (!signature.empty() && reader.error() >= 0) {
    std::string_view rest = signature;
    if (!takeRelayType(rest)) return -EINVAL;
    arguments.push_back(reader.value(signature.substr(0, signature.size() - rest.size())));
    signature = rest;
  }
  return reader.error();
}

}  // namespace sable::platform::host

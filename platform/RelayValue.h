#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

#include "platform/Data.h"

namespace sable::platform {

struct RelayValue;
struct RelayMember;

/// A record on the wire: `a{sv}`, members in the order they were added.
class RelayRecord {
 public:
  RelayRecord();
  RelayRecord(const RelayRecord&);
  RelayRecord(RelayRecord&&) noexcept;
  RelayRecord& operator=(const RelayRecord&);
  RelayRecord& operator=(RelayRecord&&) noexcept;
  ~RelayRecord();

  void add(std::string name, RelayValue value);
  /// The member, or null. Of two members with one name the first counts.
  const RelayValue* find(std::string_view name) const;
  bool empty() const;

  // Typed members; absent, or of another type, is nullopt. Integers of either signedness count
  // where they fit, and integers count as doubles.
  std::optional<std::string> string(std::string_view name) const;
  std::optional<std::uint64_t> unsignedInteger(std::string_view name) const;
  std::optional<std::int64_t> signedInteger(std::string_view name) const;
  std::optional<double> number(std::string_view name) const;
  std::optional<bool> boolean(std::string_view name) const;

  std::vector<RelayMember>& members() { return members_; }
  const std::vector<RelayMember>& members() const { return members_; }

 private:
  std::vector<RelayMember> members_;
};

using RelayStrings = std::vector<std::string>;
using RelayRecords = std::vector<RelayRecord>;
/// Name and value, order and repetitions kept: `a(ss)`.
struct RelayStringPairs {
  std::vector<std::pair<std::string, std::string>> pairs;
};
/// `a{ss}`.
struct RelayStringMap {
  std::vector<std::pair<std::string, std::string>> entries;
};
/// `a{say}`.
struct RelayDataMap {
  std::vector<std::pair<std::string, Data>> entries;
};
/// An open file that travels with a message: `ah` with none or one element. Closed with the last
/// copy.
struct RelayFile {
  std::shared_ptr<const int> descriptor;
};

/// One argument or record member. Each alternative has exactly one D-Bus type, in this order:
/// (nothing), b, x, t, d, s, ay, as, a{sv}, aa{sv}, a(ss), a{ss}, a{say}, ah. Narrower integers
/// from foreign clients are read as x or t; members of any other type are left out of a record.
struct RelayValue
    : std::variant<std::monostate, bool, std::int64_t, std::uint64_t, double, std::string, Data, RelayStrings,
                   RelayRecord, RelayRecords, RelayStringPairs, RelayStringMap, RelayDataMap, RelayFile> {
  using variant::variant;

  /// The D-Bus type of the held alternative ("" for nothing).
  std::string_view signature() const;
};

struct RelayMember {
  std::string name;
  RelayValue value;
};

using RelayArguments = std::vector<RelayValue>;

}  // namespace sable::platform

#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Dictionary.h"
#include "platform/Runtime.h"

namespace sable::platform {

/// What the clients of lookups have in common.
inline constexpr std::string_view kLookupDomain = "com.kestrel.lookup.shared";

/// Typed settings by key. Precedence: profile, then user, then what the daemon wrote, then the
/// registered default. A value of another type than asked for counts as absent and is reported
/// once at error level. Any thread; reads of the daemon's own domain do not block on the disk.
class UserDefaults {
 public:
  virtual ~UserDefaults() = default;

  /// Adds defaults of lowest precedence; `object` maps keys to values. Nothing is written.
  virtual void registerDefaults(const Dictionary& object) = 0;

  virtual std::optional<bool> boolean(std::string_view key) const = 0;
  virtual std::optional<std::int64_t> integer(std::string_view key) const = 0;
  virtual std::optional<double> number(std::string_view key) const = 0;  ///< integers count too
  virtual std::optional<std::string> string(std::string_view key) const = 0;
  virtual std::optional<WallTime> date(std::string_view key) const = 0;
  virtual std::optional<Dictionary> array(std::string_view key) const = 0;
  virtual std::optional<Dictionary> dictionary(std::string_view key) const = 0;

  /// A setting of a domain that the user's programs share, as kLookupDomain is, and as it is now; nullopt
  /// when it is absent or no boolean. May block on the disk.
  virtual std::optional<bool> sharedBoolean(std::string_view domain, std::string_view key) const = 0;

  /// Writes a value of the daemon's own (below profile and user). Null removes it. Becomes durable
  /// at the latest with synchronize().
  virtual void set(std::string_view key, const Dictionary& value) = 0;
  virtual void setDate(std::string_view key, WallTime value) = 0;

  /// Writes pending values to disk now; may block. Failure is logged once and leaves the old file.
  virtual void synchronize() = 0;
};

}  // namespace sable::platform

#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <tl/expected.hpp>

namespace sable {

/// A failure that somebody may have to be told about: who says so (`domain`), which one (`code`),
/// and a text for people (`reason`).
struct Error {
  std::string domain;
  std::int64_t code = 0;
  std::string reason;

  /// "domain code: reason", for log lines.
  std::string description() const;

  friend bool operator==(const Error&, const Error&) = default;
};

template <class T>
using Expected = tl::expected<T, Error>;

/// Errors of system calls: `code` is an errno value.
inline constexpr std::string_view kPOSIXErrorDomain = "POSIXErrorDomain";

/// The error of the system call that has just set `errno_`; `what` says what was tried.
Error posixError(int errno_, std::string_view what);

}  // namespace sable

#include "platform/Error.h"

#include <fmt/core.h>

#include <system_error>

namespace sable {

std::string Error::description() const {
  return reason.empty() ? fmt::format("{} {}", domain, code) : fmt::format("{} {}: {}", domain, code, reason);
}

Error posixError(int errno_, std::string_view what) {
  return Error{std::string(kPOSIXErrorDomain), errno_,
               fmt::format("{}: {}", what, std::generic_category().message(errno_))};
}

}  // namespace sable

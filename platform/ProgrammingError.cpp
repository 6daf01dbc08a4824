#include "platform/ProgrammingError.h"

#include <cstdio>
#include <cstdlib>

#include "platform/Log.h"

namespace sable::platform {

void programmingError(std::string_view message) {
  if (platformLog().shows(LogLevel::fault)) {
    platformLog().fault("{}", message);
  } else {
    std::fprintf(stderr, "sabled: %.*s\n", static_cast<int>(message.size()), message.data());
  }
  std::abort();
}

}  // namespace sable::platform

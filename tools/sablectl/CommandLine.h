#pragma once

#include <variant>

#include "tools/sablectl/Context.h"

namespace sable::sablectl {

/// A command line that was understood.
struct Invocation {
  Options options;
  Command command;
};

/// Reads the command line; where there is nothing to do after it (help, a usage error, both
/// already printed), the result is what to exit with.
std::variant<Invocation, ExitCode> readCommandLine(int argc, const char* const* argv);

}  // namespace sable::sablectl

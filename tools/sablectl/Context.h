#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <string>
#include <tl/expected.hpp>

#include "tools/sablectl/Host.h"
#include "tools/sablectl/Output.h"
#include "tools/sablectl/Session.h"

namespace sable::sablectl {

/// What the command line says for every command.
struct Options {
  std::filesystem::path socket;  ///< empty: where the daemon listens by default
  std::string identifier = "com.kestrel.sablectl";
  std::string agent = "sablectl/1.0";
  bool json = false;
  double timeout = 20;  ///< seconds, for each answer
};

/// What a command works with.
struct Context {
  Host& host;
  const Options& options;
  const Output& output;

  Session makeSession() const;
};

using Command = std::function<ExitCode(const Context&)>;

/// Connects and lets `use` talk to the daemon; where that is not possible says why, and how to
/// mend it.
ExitCode withSession(const Context& context, const std::function<ExitCode(Session&)>& use);

/// Tells an error on standard error; says what to exit with.
ExitCode complainOf(const Context& context, const Error& error);
/// The same, and as JSON on standard output where that is asked for: all that a command has to say.
ExitCode fail(const Context& context, const Error& error);

using Counters = std::map<std::string, std::int64_t>;
/// The daemon's counters, also while none runs; where there are none tells why, as fail() does, and
/// what to exit with.
tl::expected<Counters, ExitCode> readCounters(const Context& context);

}  // namespace sable::sablectl

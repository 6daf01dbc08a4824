#include "tools/sablectl/Context.h"

#include <fmt/format.h>

#include <cerrno>
#include <nlohmann/json.hpp>
#include <system_error>

#include "SableKit/SBLConstants.h"
#include "SableKit/SBLError.h"

namespace sable::sablectl {

Session Context::makeSession() const {
  return {host, {options.identifier, options.agent}, platform::fromSeconds(options.timeout)};
}

ExitCode withSession(const Context& context, const std::function<ExitCode(Session&)>& use) {
  Session session = context.makeSession();
  const auto connected = session.connect();
  if (connected) return use(session);
  if (connected.error().domain != kPOSIXErrorDomain) return fail(context, connected.error());
  if (context.output.json) context.output.document({{"error", encodeErrorForJSON(connected.error())}});
  complain(
      fmt::format("no daemon at {} ({}); start it with \"sabled\" or \"systemctl --user start {}.socket\"",
                  context.host.socket.string(),
                  std::generic_category().message(static_cast<int>(connected.error().code)), kSBLSubsystem));
  return kExitNoDaemon;
}

ExitCode complainOf(const Context& context, const Error& error) {
  const ExitCode code = exitCodeFor(error);
  if (code == kExitTimeout) {
    complain(fmt::format("no answer within {:g} s", context.options.timeout));
  } else {
    complain(error.description());
  }
  return code;
}

ExitCode fail(const Context& context, const Error& error) {
  if (context.output.json) context.output.document({{"error", encodeErrorForJSON(error)}});
  return complainOf(context, error);
}

tl::expected<Counters, ExitCode> readCounters(const Context& context) {
  auto counters = context.host.readCounters(context.host.counters);
  if (counters) return *std::move(counters);
  if (context.output.json) context.output.document({{"error", encodeErrorForJSON(counters.error())}});
  complain(fmt::format("no counters at {}: {}", context.host.counters.string(), counters.error().reason));
  return tl::unexpected(counters.error().code == ENOENT ? kExitNoDaemon : kExitError);
}

}  // namespace sable::sablectl

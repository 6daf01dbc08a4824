#include <nlohmann/json.hpp>

#include "SableKit/SBLRelayInterfaces.h"
#include "platform/RelaySupport.h"
#include "tools/sablectl/Commands.h"
#include "tools/sablectl/FlusherChannel.h"
#include "tools/sablectl/StreamRows.h"

namespace sable::sablectl {
namespace {

using Kind = FlusherEvent::Kind;

Expected<platform::RelayEndpoint> flusherEndpoint(Session& session) {
  return session.call(kSBLDaemonRelay, SBLDaemonRelay::listenToFlusher, {})
      .map([](const platform::RelayArguments& answer) { return std::get<std::string>(answer[0]); });
}

ExitCode daemonHasGone() {
  complain("the daemon has gone");
  return kExitNoDaemon;
}

Dictionary parsed(const std::string& text) {
  auto value = parseJSON(text, text.size());
  return value ? std::move(*value) : Dictionary(text);
}

void show(const Context& context, const FlusherEvent& event) {
  const Output& output = context.output;
  const platform::WallTime now = context.host.runtime.now();
  if (event.kind == Kind::dropped) {
    if (output.json) return output.streamDocument({{"dropped", event.count}});
    return output.line(droppedRow(output, now, event.count));
  }
  for (const std::string& text : event.texts) {
    const Dictionary record = parsed(text);
    if (output.json) {
      output.streamDocument(record);
    } else {
      output.line(event.kind == Kind::feedback ? feedbackRow(output, now, record)
                                               : sessionRow(output, now, record));
    }
  }
}

/// Shows what comes until the daemon goes; an interrupt ends the process.
ExitCode stream(const Context& context, FlusherChannel& channel) {
  context.host.exitOnInterrupt();
  while (auto event = channel.next(platform::MonotonicTime::max())) {
    if (event->kind == Kind::ended) return daemonHasGone();
    show(context, *event);
    // Only now: whoever reads slowly must not have more sent to it.
    event->reply.send({});
  }
  return kExitError;
}

/// Asks for something and waits until it is done.
ExitCode order(const Context& context, SBLFlusherIntent intent, const char* member, const char* told) {
  return withSession(context, [&](Session& session) {
    const auto endpoint = flusherEndpoint(session);
    if (!endpoint) return fail(context, endpoint.error());
    const auto channel = FlusherChannel::open(context.host, *endpoint);
    if (!channel) return fail(context, channel.error());
    const auto timeout = platform::fromSeconds(context.options.timeout);
    const auto deadline = context.host.runtime.ticks() + timeout;
    (*channel)->ask(intent, timeout);
    while (auto event = (*channel)->next(deadline)) {
      if (event->kind == Kind::ended) return daemonHasGone();
      event->reply.send({});
      if (event->kind != Kind::workDone) continue;
      if (context.output.json) {
        context.output.document({{member, true}});
      } else {
        context.output.line(told);
      }
      return kExitSuccess;
    }
    return fail(context, platform::relayTimedOut().value());
  });
}

}  // namespace

ExitCode runWatch(const Context& context, bool sent) {
  platform::RelayEndpoint endpoint;
  // The connection ends before the stream begins, so that it does not show in it.
  const ExitCode asked = withSession(context, [&](Session& session) {
    const auto told = flusherEndpoint(session);
    if (!told) return fail(context, told.error());
    endpoint = *told;
    return kExitSuccess;
  });
  if (asked != kExitSuccess) return asked;
  const auto channel = FlusherChannel::open(context.host, endpoint);
  if (!channel) return fail(context, channel.error());
  (*channel)->ask(sent ? SBLFlusherIntent::watchSessions : SBLFlusherIntent::watchFeedback,
                  platform::fromSeconds(context.options.timeout));
  if (!context.output.json)
    context.output.line(sent ? sessionHeading(context.output) : feedbackHeading(context.output));
  return stream(context, **channel);
}

ExitCode runStop(const Context& context) {
  return order(context, SBLFlusherIntent::stop, "stopped", "nothing is uploaded until the next dump");
}

ExitCode runDump(const Context& context) {
  return order(context, SBLFlusherIntent::dump, "dumped", "all sessions have ended and are being uploaded");
}

}  // namespace sable::sablectl

#include <fmt/format.h>

#include <chrono>
#include <nlohmann/json.hpp>

#include "SableKit/SBLError.h"
#include "SableKit/SBLRelayInterfaces.h"
#include "platform/PropertyList.h"
#include "tools/sablectl/Commands.h"
#include "tools/sablectl/RecordDocument.h"
#include "tools/sablectl/Text.h"

namespace sable::sablectl {
namespace {

constexpr std::size_t kMaximumBagBytes = 8u << 20;
/// Where the daemon notes when a kept bag expires, in seconds since 1970.
constexpr const char* kExpirationKey = "__expiration";

/// Asks for the sessions: that the daemon answers is what counts. The exit code goes to `code`.
Dictionary openSessions(const Context& context, ExitCode& code, Dictionary& problem) {
  Session session = context.makeSession();
  const auto fault = [&](const Error& error, ExitCode failure) {
    code = failure;
    problem = encodeErrorForJSON(error);
    return Dictionary(nullptr);
  };
  if (const auto connected = session.connect(); !connected) {
    const bool nobody = connected.error().domain == kPOSIXErrorDomain;
    return fault(connected.error(), nobody ? kExitNoDaemon : exitCodeFor(connected.error()));
  }
  const auto sessions = session.call(kSBLDaemonRelay, SBLDaemonRelay::listSessions, {});
  if (!sessions) return fault(sessions.error(), exitCodeFor(sessions.error()));
  return recordDocuments(std::get<platform::RelayRecords>((*sessions)[0]));
}

/// Who opened the listener, as the kernel knows: under socket activation that is the service
/// manager, not the daemon.
void addPeer(const Context& context, Dictionary& status) {
  status["pid"] = nullptr;
  status["executable"] = nullptr;
  const auto connection = context.host.relay.connect(context.host.endpointOf(context.host.socket));
  if (!connection) return;
  const pid_t pid = (*connection)->peer().pid;
  status["pid"] = pid;
  if (const auto path = context.host.relay.executablePath(pid)) status["executable"] = *path;
}

Dictionary daemonStatus(const Context& context, ExitCode& code) {
  Dictionary status = Dictionary::object();
  Dictionary problem;
  status["socket"] = context.host.socket.string();
  Dictionary sessions = openSessions(context, code, problem);
  status["answers"] = code == kExitSuccess;
  addPeer(context, status);
  status["error"] = std::move(problem);
  status["sessions"] = std::move(sessions);
  return status;
}

Dictionary placesStatus(const Host& host) {
  Dictionary places = Dictionary::array();
  for (const auto& [name, path] : host.places) {
    std::error_code error;
    const bool exists = std::filesystem::exists(path, error);
    Dictionary place;
    place["name"] = name;
    place["path"] = path.string();
    place["exists"] = error ? Dictionary(nullptr) : Dictionary(exists);
    places.push_back(std::move(place));
  }
  return places;
}

std::int64_t secondsBetween(platform::WallTime from, platform::WallTime to) {
  return std::chrono::round<std::chrono::seconds>(to - from).count();
}

Dictionary bagStatus(const Host& host) {
  const auto path = host.caches / "bag.plist";
  Dictionary status;
  status["file"] = path.string();
  const auto bytes = host.fileManager.read(path, kMaximumBagBytes);
  const auto bag = bytes ? platform::decodePropertyList(*bytes) : tl::unexpected(bytes.error());
  if (!bag || !bag->is_object()) {
    status["error"] = bag ? "not a dictionary" : bag.error().reason;
    return status;
  }
  const auto version = bag->find("version");
  status["version"] = version == bag->end() ? Dictionary(nullptr) : *version;
  std::error_code error;
  const auto written = std::filesystem::last_write_time(path, error);
  const auto now = host.runtime.now();
  status["age_seconds"] =
      error ? Dictionary(nullptr) : Dictionary(secondsBetween(std::chrono::file_clock::to_sys(written), now));
  const auto expiration = numberMember(*bag, kExpirationKey);
  status["expires_in_seconds"] =
      expiration ? Dictionary(secondsBetween(now, platform::wallTimeFromSecondsSince1970(*expiration)))
                 : Dictionary(nullptr);
  return status;
}

Dictionary activitiesStatus(const Host& host) {
  const auto now = host.runtime.now();
  const auto distance = [](const auto& time, const auto& seconds) {
    return time ? Dictionary(seconds(*time)) : Dictionary(nullptr);
  };
  Dictionary activities = Dictionary::array();
  for (const auto& [identifier, times] : host.readActivities()) {
    Dictionary one;
    one["identifier"] = identifier;
    one["last_run_seconds_ago"] =
        distance(times.lastRun, [&](auto time) { return secondsBetween(time, now); });
    one["next_run_in_seconds"] =
        distance(times.nextRun, [&](auto time) { return secondsBetween(now, time); });
    activities.push_back(std::move(one));
  }
  return activities;
}

Dictionary facilitiesStatus(const Host& host) {
  Dictionary facilities = Dictionary::array();
  for (const auto& [facility, available, detail] : host.availability()) {
    Dictionary one;
    one["facility"] = facility;
    one["available"] = available;
    one["detail"] = detail;
    facilities.push_back(std::move(one));
  }
  return facilities;
}

std::string bagText(const Dictionary& bag) {
  if (bag.contains("error")) return "cannot be read: " + plainText(bag["error"]);
  std::string text = "version " + plainText(bag["version"]);
  if (const auto age = integerMember(bag, "age_seconds")) text += fmt::format(", {} old", durationText(*age));
  if (const auto rest = integerMember(bag, "expires_in_seconds"))
    text += *rest < 0 ? fmt::format(", expired {} ago", durationText(*rest))
                      : fmt::format(", expires in {}", durationText(*rest));
  return text;
}

std::string lastRunText(const Dictionary& activity) {
  const auto ago = integerMember(activity, "last_run_seconds_ago");
  return ago ? fmt::format("ran {} ago", duration(*ago)) : "has not run";
}

std::string nextRunText(const Dictionary& activity) {
  const auto rest = integerMember(activity, "next_run_in_seconds");
  if (!rest) return "nothing planned";
  return *rest < 0 ? fmt::format("was due {} ago", duration(*rest))
                   : fmt::format("next in {}", duration(*rest));
}

std::string openerText(const Dictionary& daemon) {
  if (daemon["pid"].is_null()) return "unknown";
  const Dictionary& executable = daemon["executable"];
  return fmt::format("{} ({})", daemon["pid"].get<std::int64_t>(),
                     executable.is_null() ? "executable cannot be read" : plainText(executable));
}

using Rows = std::vector<std::vector<std::string>>;

void print(const Output& output, const Dictionary& status) {
  const auto section = [&](std::string_view title, const Rows& rows) {
    output.line(output.paint(Colour::bold, title));
    for (const std::string& line : aligned(rows)) output.line("  " + line);
  };
  const Dictionary& daemon = status["daemon"];
  const bool answers = daemon["answers"].get<bool>();
  section("Daemon", {{"socket", plainText(daemon["socket"])},
                     {"answers", answers ? "yes" : "no: " + plainText(daemon["error"]["reason"])},
                     {"opened by", openerText(daemon)}});
  section("Bag", {{"kept", bagText(status["bag"])}, {"file", plainText(status["bag"]["file"])}});
  Rows places;
  for (const Dictionary& place : status["places"]) {
    places.push_back({plainText(place["name"]), plainText(place["path"]),
                      place["exists"] == true    ? ""
                      : place["exists"] == false ? "missing"
                                                 : "cannot be seen"});
  }
  section("Files", places);
  Rows activities;
  for (const Dictionary& one : status["activities"])
    activities.push_back({plainText(one["identifier"]), lastRunText(one), nextRunText(one)});
  if (!activities.empty()) section("In the background", activities);
  Rows facilities;
  for (const Dictionary& one : status["facilities"]) {
    facilities.push_back({plainText(one["facility"]),
                          one["available"] == true ? "available" : "not available",
                          plainText(one["detail"])});
  }
  section("Host, as this program sees it", facilities);
  if (!answers) return;
  output.line(output.paint(Colour::bold, "Sessions"));
  for (const std::string& line : tableLines(daemon["sessions"])) output.line("  " + line);
}

}  // namespace

ExitCode runStatus(const Context& context) {
  ExitCode code = kExitSuccess;
  Dictionary status;
  status["daemon"] = daemonStatus(context, code);
  status["bag"] = bagStatus(context.host);
  status["places"] = placesStatus(context.host);
  status["activities"] = activitiesStatus(context.host);
  status["facilities"] = facilitiesStatus(context.host);
  if (context.output.json) {
    context.output.document(status);
  } else {
    print(context.output, status);
  }
  return code;
}

}  // namespace sable::sablectl

#include <unistd.h>

#include <csignal>
#include <cstdio>

#include "platform/host/Folders.h"
#include "platform/host/HostActivityScheduler.h"
#include "platform/host/HostFacts.h"
#include "platform/host/HostFileManager.h"
#include "platform/host/HostLocation.h"
#include "platform/host/HostMemoryPressure.h"
#include "platform/host/HostNotify.h"
#include "platform/host/HostRelay.h"
#include "platform/host/HostRuntime.h"
#include "platform/host/MappedTally.h"
#include "platform/host/TransferStore.h"
#include "platform/host/UnixSocket.h"
#include "tools/sablectl/CommandLine.h"

namespace {

using namespace sable::sablectl;
namespace host = sable::platform::host;

/// One thread reads answers while the main thread waits for them.
constexpr unsigned kThreads = 1;

std::vector<NamedPath> placesOf(const host::Folders& folders) {
  return {{"runtime folder", folders.runtime},       {"caches folder", folders.caches},
          {"state folder", folders.state},           {"counters", folders.counters()},
          {"user settings", folders.userSettings()}, {"profile settings", folders.profileSettings},
          {"user facts", folders.userFacts()},       {"system facts", folders.systemFacts}};
}

std::vector<sable::platform::Availability> probe(const host::Folders& folders, host::HostRuntime& runtime) {
  sable::platform::NotificationCenter notificationCenter;
  const host::HostFacts facts(folders, {}, runtime.reactor(), notificationCenter);
  return {host::HostLocationService(runtime, facts, notificationCenter).availability(),
          host::HostNotify(runtime).availability(),
          host::HostMemoryPressure(runtime.reactor()).availability()};
}

sable::platform::ActivityRecord activitiesIn(host::HostFileManager& fileManager,
                                             const std::filesystem::path& file) {
  const auto text = fileManager.read(file, host::kMaximumActivityRecordBytes);
  return text ? host::decodeActivityRecord(*text) : sable::platform::ActivityRecord();
}

/// Lines are written whole and at once: nothing is lost.
void exitOnInterrupt() {
  for (const int number : {SIGINT, SIGTERM}) std::signal(number, [](int) { _exit(kExitSuccess); });
}

sable::Expected<std::vector<KeptUpload>> readUploads(const host::Folders& folders) {
  const auto rows = host::TransferDatabase::read(host::TransferStore::databaseIn(folders.state));
  if (!rows) return tl::unexpected(rows.error());
  std::vector<KeptUpload> uploads;
  for (const auto& row : *rows) {
    if (row.transfer.task.kind != sable::platform::HTTPBackgroundTaskKind::upload) continue;
    uploads.push_back({row.transfer, row.size});
  }
  return uploads;
}

std::optional<std::filesystem::path> uploadBody(const host::Folders& folders, std::int64_t identifier) {
  auto path = host::TransferStore::bodyIn(folders.state, identifier);
  return path.empty() ? std::nullopt : std::optional(std::move(path));
}

ExitCode run(const Invocation& invocation) {
  const auto folders = host::Folders::fromEnvironment();
  const auto socket = invocation.options.socket.empty()
                          ? folders.socket()
                          : std::filesystem::absolute(invocation.options.socket);
  host::HostRuntime runtime(kThreads);
  host::HostFileManager fileManager(folders);
  host::HostRelayConfiguration configuration;
  configuration.runtimeFolder = folders.runtime;
  configuration.socketPath = socket;
  host::HostRelay relay(runtime, configuration);
  Host machine{
      .runtime = runtime,
      .relay = relay,
      .fileManager = fileManager,
      .socket = socket,
      .caches = folders.caches,
      .counters = folders.counters(),
      .places = placesOf(folders),
      .endpointOf = [](const std::filesystem::path& path) { return host::endpointOf(path.native()); },
      .readCounters = host::MappedTally::snapshotOf,
      .readUploads = [&folders] { return readUploads(folders); },
      .uploadBody = [&folders](std::int64_t identifier) { return uploadBody(folders, identifier); },
      .availability = [&folders, &runtime] { return probe(folders, runtime); },
      .readActivities = [&] { return activitiesIn(fileManager, folders.activityRuns()); },
      .exitOnInterrupt = exitOnInterrupt,
  };
  const Output output = Output::standard(invocation.options.json);
  const ExitCode code = invocation.command({machine, invocation.options, output});
  if (std::ferror(stdout) == 0) return code;
  complain("standard output could not be written");
  return kExitError;
}

}  // namespace

int main(int argc, char** argv) {
  const auto read = readCommandLine(argc, argv);
  const auto* invocation = std::get_if<Invocation>(&read);
  return invocation != nullptr ? run(*invocation) : std::get<ExitCode>(read);
}

#pragma once

#include <cstdint>
#include <filesystem>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "platform/BackgroundTransfers.h"
#include "platform/FileManager.h"
#include "platform/Process.h"
#include "platform/Relay.h"
#include "platform/Runtime.h"
#include "platform/TimedActivityScheduler.h"

namespace sable::sablectl {

struct NamedPath {
  std::string name;
  std::filesystem::path path;
};

/// An upload as the daemon's files tell it.
struct KeptUpload {
  platform::BackgroundTransfer transfer;
  std::int64_t size = 0;  ///< of its body, as it is sent
};

/// What the commands use of the machine; main.cpp provides it. Outlives every command.
struct Host {
  platform::Runtime& runtime;
  platform::Relay& relay;
  platform::FileManager& fileManager;

  std::filesystem::path socket;
  std::filesystem::path caches;    ///< the daemon's own
  std::filesystem::path counters;  ///< the file
  std::vector<NamedPath> places;   ///< folders and files of the daemon, in the order in which they are told

  std::function<platform::RelayEndpoint(const std::filesystem::path&)> endpointOf;
  std::function<Expected<std::map<std::string, std::int64_t>>(const std::filesystem::path&)> readCounters;
  /// Oldest first.
  std::function<Expected<std::vector<KeptUpload>>()> readUploads;
  /// The file with an upload's body, where it is kept.
  std::function<std::optional<std::filesystem::path>(std::int64_t identifier)> uploadBody;
  std::function<std::vector<platform::Availability>()> availability;
  /// What the daemon has planned in the background; empty where it has noted nothing.
  std::function<platform::ActivityRecord()> readActivities;
  /// From here on an interrupt or a request to terminate is the orderly end of the process.
  std::function<void()> exitOnInterrupt;
};

}  // namespace sable::sablectl

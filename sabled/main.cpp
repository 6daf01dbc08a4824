#include <CLI/CLI.hpp>
#include <cstdio>
#include <string>
#include <vector>

#include "SableKit/SBLConstants.h"
#include "platform/host/Allocation.h"
#include "platform/host/ConfigurationSchema.h"
#include "platform/host/Folders.h"
#include "platform/host/HostLog.h"
#include "platform/host/HostPlatform.h"
#include "sabled/SableDaemon.h"

namespace {

using sable::platform::LogLevel;

constexpr int kExitFailure = 1;
constexpr int kExitUsage = 2;

struct Options {
  LogLevel logLevel = LogLevel::standard;
  std::vector<std::string> logCategories;
  std::string socket;
  bool checkConfig = false;
};

void declareOptions(CLI::App& app, Options& options) {
  app.set_version_flag("--version", std::string(sable::kSBLSabledNameVersion));
  const std::map<std::string, LogLevel> levels{{"debug", LogLevel::debug},
                                               {"info", LogLevel::info},
                                               {"default", LogLevel::standard},
                                               {"error", LogLevel::error},
                                               {"fault", LogLevel::fault}};
  app.add_option("--log-level", options.logLevel, "Lowest level to log: debug, info, default, error or fault")
      ->transform(CLI::CheckedTransformer(levels))
      ->type_name("LEVEL");
  app.add_option("--log-category", options.logCategories, "Log only this category (repeatable)")
      ->type_name("NAME");
  app.add_option("--socket", options.socket,
                 "Listen on this socket instead of relay.sock in the runtime folder")
      ->type_name("PATH");
  app.add_flag("--check-config", options.checkConfig, "Check settings and facts, then exit");
}

int checkConfiguration() {
  using namespace sable::platform::host;
  const auto problems = checkConfiguration(Folders::fromEnvironment());
  for (const std::string& problem : problems) std::fprintf(stderr, "%s\n", problem.c_str());
  return problems.empty() ? 0 : kExitUsage;
}

int run(const Options& options) {
  sable::platform::host::shareOneHeap();
  sable::platform::host::HostLog log(options.logLevel, options.logCategories);
  sable::platform::installLogSink(&log);
  sable::platform::host::HostPlatform platform({.socketPath = options.socket});
  if (!platform.configurationIsReadable()) platform.process().exit(kExitUsage);
  sable::SableDaemon daemon(platform);
  if (const auto started = daemon.start(); !started) {
    std::fprintf(stderr, "sabled: %s\n", started.error().reason.c_str());
    platform.process().exit(kExitFailure);
  }
  sable::platform::host::releaseStartUpPages();
  platform.process().runMainLoop();
  platform.process().exit(0);
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  CLI::App app("Stands between search clients and a search service.", "sabled");
  Options options;
  declareOptions(app, options);
  try {
    app.parse(argc, argv);
  } catch (const CLI::CallForHelp& help) {
    return app.exit(help);
  } catch (const CLI::CallForVersion& version) {
    return app.exit(version);
  } catch (const CLI::ParseError& error) {
    std::fprintf(stderr, "sabled: %s\n", error.what());
    return kExitUsage;
  }
  return options.checkConfig ? checkConfiguration() : run(options);
}

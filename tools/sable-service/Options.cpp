#include "Options.h"

#include <fmt/format.h>

#include <CLI/CLI.hpp>
#include <cstdlib>

namespace service {

namespace {

std::filesystem::path defaultData() {
  const char* cache = std::getenv("XDG_CACHE_HOME");
  const char* home = std::getenv("HOME");
  std::filesystem::path folder;
  if (cache != nullptr && *cache != '\0')
    folder = cache;
  else
    folder = std::filesystem::path(home != nullptr ? home : "/") / ".cache";
  return folder / "com.kestrel.sable-service";
}

}  // namespace

CommandLine readCommandLine(int argc, char** argv) {
  CommandLine line;
  auto& options = line.options;
  options.data = defaultData();
  CLI::App app("Reference search service on 127.0.0.1, for development and tests", "sable-service");
  app.add_option("--port", options.port, "port, 0 picks a free one")->check(CLI::Range(0, 65535));
  app.add_option("--data", options.data, "folder of the search index, built when missing");
  app.add_option("--record", options.record, "folder for requests.jsonl, every request on a line");
  app.add_option("--bag", options.bag, "JSON file with bag keys that stand over the built-in ones");
  app.add_option("--fault", options.faults, "PATH:KIND[=VALUE][*COUNT][@SKIP], repeatable")
      ->allow_extra_args(false)
      ->take_all();
  try {
    app.parse(argc, argv);
  } catch (const CLI::Success& success) {
    line.exitCode = app.exit(success);
  } catch (const CLI::ParseError& error) {
    fmt::print(stderr, "sable-service: {}\n", error.what());
    line.exitCode = 2;
  }
  return line;
}

}  // namespace service

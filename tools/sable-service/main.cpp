#include <fmt/format.h>

#include <csignal>
#include <cstdio>
#include <fstream>
#include <iterator>
#include <memory>

#include "Faults.h"
#include "Index.h"
#include "Options.h"
#include "Recorder.h"
#include "Server.h"
#include "Service.h"

namespace service {
namespace {

int complain(int code, const std::string& reason) {
  fmt::print(stderr, "sable-service: {}\n", reason);
  return code;
}

Json readBag(const std::filesystem::path& path) {
  std::ifstream file(path);
  return Json::parse(std::string(std::istreambuf_iterator<char>(file), {}), nullptr, false);
}

/// Serves until SIGINT or SIGTERM, which every thread has blocked.
int serve(const Options& options, const Json& bagKeys, Faults& faults, const sigset_t& signals) {
  Recorder recorder;
  if (options.record) {
    if (const auto reason = recorder.open(*options.record)) return complain(1, *reason);
  }
  const Index index(options.data);
  std::unique_ptr<Service> service;
  Server server(
      [&](const Request& request, httplib::Response& response) { service->handle(request, response); },
      [&](const std::string& path) { return faults.planReading(path); });
  const int port = server.bind(options.port);
  if (port == 0) return complain(1, fmt::format("cannot listen on 127.0.0.1:{}", options.port));
  const std::string base = fmt::format("http://127.0.0.1:{}", port);
  service = std::make_unique<Service>(base, index, faults, recorder);
  service->bag().merge(bagKeys);
  server.start();
  fmt::print("{}\n", base);
  std::fflush(stdout);
  int signal = 0;
  sigwait(&signals, &signal);
  server.stop();
  return 0;
}

int run(int argc, char** argv) {
  const auto [options, exitCode] = readCommandLine(argc, argv);
  if (exitCode) return *exitCode;
  Faults faults;
  for (const auto& rule : options.faults) {
    if (const auto reason = faults.add(rule)) return complain(2, *reason);
  }
  const Json bagKeys = options.bag ? readBag(*options.bag) : Json::object();
  if (!bagKeys.is_object()) return complain(2, fmt::format("{} is no JSON object", options.bag->string()));
  sigset_t signals;
  sigemptyset(&signals);
  sigaddset(&signals, SIGINT);
  sigaddset(&signals, SIGTERM);
  sigprocmask(SIG_BLOCK, &signals, nullptr);
  try {
    return serve(options, bagKeys, faults, signals);
  } catch (const std::exception& error) {
    return complain(1, error.what());
  }
}

}  // namespace
}  // namespace service

int main(int argc, char** argv) {
  return service::run(argc, argv);
}

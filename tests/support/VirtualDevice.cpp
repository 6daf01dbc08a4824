#include "tests/support/VirtualDevice.h"

#include <stdexcept>

#include "SableKit/SBLConstants.h"
#include "SableKit/SBLRelayCoding.h"
#include "SableKit/SBLRelayInterfaces.h"
#include "sabled/SableBagController.h"

namespace sable::test {

using platform::HTTPRequest;
using platform::RelayArguments;
using platform::RelayCall;
using platform::RelayRecord;
using platform::simulated::Scripted;

Scripted answering(std::string body, int status) {
  Scripted answer;
  answer.status = status;
  answer.body = std::move(body);
  return answer;
}

Scripted failing(platform::HTTPErrorCode error) {
  Scripted answer;
  answer.error = error;
  return answer;
}

Scripted after(platform::Duration latency, Scripted answer) {
  answer.latency = latency;
  return answer;
}

SBLSearchRequest searchFor(std::string text, std::uint64_t queryId) {
  SBLSearchRequest request;
  request.queryId = queryId;
  request.queryString = std::move(text);
  return request;
}

std::string sentValue(const HTTPRequest& request, std::string_view name) {
  if (const std::string* header = request.headers.find(name)) return *header;
  for (const auto& item : platform::URL::parse(request.url)->queryItems()) {
    if (item.name == name) return item.value.value_or("");
  }
  return "-";
}

namespace {

constexpr platform::Duration kPatience = 30s;

Scripted completing(const HTTPRequest& request) {
  const std::string query = sentValue(request, "q") + "ther";
  return answering(json::array({{{"query", query}, {"completion_score", 0.5}, {"status", "OK"}}}).dump());
}

}  // namespace

VirtualClient::VirtualClient(VirtualDevice& device, platform::RelayEndpoint endpoint, pid_t pid)
    : device_(device) {
  auto connected = device.platform.relay().connectAs(endpoint, {pid, 1000});
  if (!connected) throw std::runtime_error(connected.error().description());
  connection_ = std::move(*connected);
  connection_->exportObject(kSBLClientRelay, [state = state_](RelayCall call) {
    state->bags.push_back({json::parse(std::get<std::string>(call.arguments[0]), nullptr, false),
                           std::get<std::string>(call.arguments[1]),
                           decodeError(std::get<RelayRecord>(call.arguments[2]))});
    call.reply.send({});
  });
  connection_->setInvalidationHandler([state = state_] { state->invalidated = true; });
  connection_->resume();
}

VirtualClient::~VirtualClient() {
  connection_->invalidate();
}

void VirtualClient::configure(std::string identifier, std::string agent) {
  connection_->call(kSBLDaemonRelay, SBLDaemonRelay::configure,
                    {encodeConfiguration({std::move(identifier), std::move(agent)})}, kPatience,
                    [state = state_](Expected<RelayArguments> answer) {
                      if (answer) state->endpoint = std::get<std::string>((*answer)[0]);
                    });
}

PendingAnswer VirtualClient::send(SBLAnyRequest request) {
  auto pending = std::make_shared<std::optional<Answer>>();
  connection_->call(kSBLDaemonRelay, SBLDaemonRelay::request,
                    {std::string(requestClassName(request)), encodeRequest(request)}, kPatience,
                    [pending](Expected<RelayArguments> answer) {
                      if (!answer) return pending->emplace(Answer{0, std::nullopt, answer.error()}), void();
                      pending->emplace(Answer{std::get<std::uint64_t>((*answer)[0]),
                                              decodeReply(std::get<RelayRecord>((*answer)[1])),
                                              decodeError(std::get<RelayRecord>((*answer)[2]))});
                    });
  return pending;
}

Answer VirtualClient::ask(SBLAnyRequest request) {
  const auto pending = send(std::move(request));
  device_.await(pending);
  return **pending;
}

Expected<RelayArguments> VirtualClient::call(const platform::RelayInterface& interface, std::size_t method,
                                             RelayArguments arguments) {
  const auto answer = std::make_shared<std::optional<Expected<RelayArguments>>>();
  connection_->call(interface, method, std::move(arguments), kPatience,
                    [answer](Expected<RelayArguments> result) { *answer = std::move(result); });
  device_.platform.runtime().runUntil([&] { return answer->has_value(); }, kPatience);
  device_.run();
  return answer->value();
}

Answer VirtualClient::search(std::string text) {
  return ask(searchFor(std::move(text), ++queryId_));
}

VirtualDevice::VirtualDevice(std::uint64_t seed) : platform(seed) {
  bag = {{"version", "1"},
         {"enabled", true},
         {"feedback_enabled", true},
         {"search_url", "https://service.test/search"},
         {"warm_url", "https://service.test/warm"}};
  platform.userDefaults().setByUser("SBLDefaultBagURL", "https://service.test/bag");
  platform.userDefaults().setByUser("SBLDefaultBagURLCN", "https://cn.service.test/bag");
  platform.relay().setExecutablePath(100, "/usr/bin/beacon");
  service.on("/bag", [this](const HTTPRequest&) { return answering(bag.dump()); });
  service.on("/search", completing);
  for (const char* path : {"/warm", "/more", "/card"}) service.on(path, answering("{}"));
}

VirtualDevice::~VirtualDevice() {
  for (VirtualClient& client : clients_) client.disconnect();
  run();
}

void VirtualDevice::start() {
  daemon_ = std::make_unique<SableDaemon>(platform);
  if (const auto started = daemon_->start(); !started)
    throw std::runtime_error(started.error().description());
  advance(200ms);
}

VirtualClient& VirtualDevice::startWithClient() {
  start();
  return client();
}

void VirtualDevice::publishBag() {
  const int version = std::stoi(bag["version"].get<std::string>()) + 1;
  bag["version"] = std::to_string(version);
  assembly().bagController->forceFetchBag({{"bag", version}});
  advance(1s);
}

void VirtualDevice::killDaemon() {
  platform.runtime().dropWork();
  clients_.clear();
  platform.runtime().dropWork();
  daemon_.reset();
  platform.runtime().dropWork();
}

void VirtualDevice::restart() {
  clients_.clear();
  run();
  daemon_.reset();
  start();
}

void VirtualDevice::await(const PendingAnswer& answer) {
  if (!platform.runtime().runUntil([&] { return answer->has_value(); }, kPatience)) {
    throw std::runtime_error("no answer in 30 s of virtual time");
  }
}

VirtualClient& VirtualDevice::connect(pid_t pid) {
  return clients_.emplace_back(*this, "unix:path=/simulated/" + std::string(kSBLServiceName), pid);
}

VirtualClient& VirtualDevice::client(std::string identifier, std::string agent) {
  VirtualClient& client = connect();
  client.configure(std::move(identifier), std::move(agent));
  run();
  return client;
}

std::string VirtualDevice::bagFile() {
  for (const auto& [path, bytes] : platform.fileManager().files()) {
    if (path.filename() == "bag.plist") return bytes;
  }
  return {};
}

}  // namespace sable::test

#include "Service.h"

#include <fmt/chrono.h>
#include <fmt/format.h>
#include <httplib.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <ctime>

#include "Connection.h"
#include "Images.h"

namespace service {

namespace {

using std::chrono::milliseconds;

double secondsNow() {
  const auto now = std::chrono::system_clock::now().time_since_epoch();
  return static_cast<double>(std::chrono::duration_cast<std::chrono::microseconds>(now).count()) / 1e6;
}

/// The body a piece at a time, ended early or slowed down as planned; false closes the connection.
bool sendPart(const std::string& body, size_t length, const FaultPlan& plan, size_t offset,
              httplib::DataSink& sink) {
  static constexpr std::array<char, 65536> kZeros{};
  auto& connection = Connection::current();
  const size_t end = std::min(length, plan.truncateAfter.value_or(length));
  const size_t speed = plan.bytesPerSecond.value_or(0);
  const size_t piece = speed == 0 ? end : std::max<size_t>(1, speed / 10);
  if (offset >= end) return false;
  const bool inBody = offset < body.size();
  const size_t count = std::min({piece, end - offset, inBody ? body.size() - offset : kZeros.size()});
  if (speed > 0 && !connection.pause(milliseconds(count * 1000 / speed))) return false;
  return sink.write(inBody ? body.data() + offset : kZeros.data(), count) &&
         (speed == 0 || connection.flush());
}

void deliver(Answer answer, const FaultPlan& plan, httplib::Response& response) {
  response.status = answer.status;
  response.set_header("Date", fmt::format("{:%a, %d %b %Y %H:%M:%S GMT}", fmt::gmtime(std::time(nullptr))));
  for (const auto& [name, value] : answer.headers) response.set_header(name, value);
  if (plan.truncateAfter || plan.bytesPerSecond || answer.zeros > 0) {
    const size_t length = answer.body.size() + answer.zeros;
    auto send = [body = std::move(answer.body), length, plan](size_t offset, size_t,
                                                              httplib::DataSink& sink) {
      return sendPart(body, length, plan, offset, sink);
    };
    response.set_content_provider(length, answer.type, std::move(send));
  } else if (!answer.body.empty()) {
    response.set_content(answer.body, answer.type);
  }
  auto& connection = Connection::current();
  if (plan.latency.count() > 0) connection.pause(plan.latency);
  if (plan.reset) connection.reset();
}

}  // namespace

Service::Service(const std::string& base, const Index& index, Faults& faults, Recorder& recorder)
    : bag_(base), search_(index, base), faults_(faults), recorder_(recorder) {}

void Service::handle(const Request& request, httplib::Response& response) {
  const double arrival = secondsNow();
  const bool refused = response.status >= 400;
  // Control is how a test takes faults away again.
  const FaultPlan plan = refused || request.path == "/control" ? FaultPlan() : faults_.plan(request.path);
  Answer answer;
  try {
    answer = refused ? Answer::error(response.status, "the request was refused") : route(request, plan);
  } catch (const Json::exception& error) {
    answer = Answer::error(400, error.what());
  } catch (const std::exception& error) {
    answer = Answer::error(500, error.what());
  }
  plan.apply(answer);
  recorder_.write(arrival, request, answer, plan.rules);
  deliver(std::move(answer), plan, response);
}

Answer Service::route(const Request& request, const FaultPlan& plan) {
  if (request.method == "GET" || request.method == "HEAD") return get(request, plan);
  if (request.method == "POST") return post(request, plan);
  return Answer::error(404, "there is nothing here for that method");
}

Answer Service::get(const Request& request, const FaultPlan& plan) {
  const auto& path = request.path;
  if (path == "/bag") return bag_.answer(request, plan.bagVersion);
  if (path == "/search") return search_.search(request);
  if (path == "/lookup") return search_.lookUp(request);
  if (path == "/more") return search_.more(request);
  if (path == "/card") return search_.card(request);
  if (path == "/warm") return Answer::empty(204);
  if (path.starts_with("/images/")) return imageAnswer(request);
  if (path.starts_with("/resources/")) return bag_.resourceAnswer(request);
  return Answer::error(404, "there is nothing at this path");
}

Answer Service::post(const Request& request, const FaultPlan& plan) {
  const auto& path = request.path;
  if (path == "/feedback" || path == "/crowdsourcing") return uploads_.receive(request, !plan.refuses());
  if (path == "/control") return control(request);
  return Answer::error(404, "there is nothing at this path");
}

Answer Service::control(const Request& request) {
  const Json order = Json::parse(request.body, nullptr, false);
  if (!order.is_object()) return Answer::error(400, "the order is no JSON object");
  if (order.value("clear_faults", false)) faults_.clear();
  Json rules = order.value("fault", Json::array());
  if (rules.is_string()) rules = Json::array({rules});
  for (const auto& rule : rules) {
    if (auto reason = faults_.add(rule.get<std::string>())) return Answer::error(400, *reason);
  }
  if (!order.value("bag", Json::object()).is_object())
    return Answer::error(400, "the bag's keys are no JSON object");
  if (order.contains("bag")) bag_.merge(order["bag"]);
  if (order.contains("bag_version")) bag_.merge({{"version", order["bag_version"]}});
  const Json resources = order.value("resource", Json::object());
  for (const auto& [identifier, content] : resources.items()) {
    bag_.setResource(identifier, content.get<std::string>());
  }
  return Answer::json({{"status", "OK"}});
}

}  // namespace service

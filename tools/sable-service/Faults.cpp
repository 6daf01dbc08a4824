#include "Faults.h"

#include <fmt/format.h>

#include <algorithm>
#include <array>
#include <charconv>
#include <limits>
#include <string_view>

namespace service {

namespace {

enum class Value { none, number, text };

struct Kind {
  std::string_view name;
  Value value;
  size_t least = 0;
  size_t most = std::numeric_limits<size_t>::max();
};

constexpr size_t kHourInMilliseconds = 3'600'000;

constexpr std::array kKinds = {
    Kind{"latency", Value::number, 0, kHourInMilliseconds},
    Kind{"status", Value::number, 200, 599},
    Kind{"reset", Value::none},
    Kind{"truncate", Value::number},
    Kind{"slow", Value::number, 1},
    Kind{"redirect", Value::text},
    Kind{"body", Value::text},
    Kind{"retry-after", Value::text},
    Kind{"version", Value::text},
    Kind{"reset-body", Value::number},
    Kind{"slow-body", Value::number, 1},
};

std::optional<size_t> number(std::string_view text) {
  size_t value = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), value);
  return error == std::errc() && end == text.data() + text.size() ? std::optional(value) : std::nullopt;
}

/// Takes a mark with a number behind it off the end.
std::optional<size_t> takeSuffix(std::string& text, char mark) {
  const auto at = text.rfind(mark);
  if (at == text.npos) return std::nullopt;
  const auto value = number(std::string_view(text).substr(at + 1));
  if (value) text.resize(at);
  return value;
}

/// Why the value does not suit the kind.
std::optional<std::string> objection(const Kind& kind, bool given, const std::string& value) {
  if (kind.value == Value::none) {
    return given ? std::optional(fmt::format("\"{}\" takes no value", kind.name)) : std::nullopt;
  }
  if (!given) return fmt::format("\"{}\" needs a value", kind.name);
  if (value.find_first_of("\r\n") != value.npos) return "a value is one line";
  if (kind.value == Value::text) return std::nullopt;
  const auto parsed = number(value);
  if (!parsed || *parsed < kind.least || *parsed > kind.most) {
    return fmt::format("\"{}\" is no value for \"{}\"", value, kind.name);
  }
  return std::nullopt;
}

bool covers(const std::string& rule, const std::string& path) {
  if (!path.starts_with(rule)) return false;
  return path.size() == rule.size() || rule.ends_with('/') || path[rule.size()] == '/';
}

}  // namespace

std::optional<std::string> Faults::add(const std::string& text) {
  const auto refuse = [&](const std::string& reason) {
    return fmt::format("fault \"{}\": {}", text, reason);
  };
  Rule rule;
  std::string rest = text;
  rule.skip = takeSuffix(rest, '@').value_or(0);
  rule.count = takeSuffix(rest, '*');
  const auto colon = rest.find(':');
  if (!rest.starts_with('/') || colon == rest.npos) return refuse("is not PATH:KIND[=VALUE][*COUNT][@SKIP]");
  const auto equals = rest.find('=', colon);
  const bool valueGiven = equals != rest.npos;
  rule.text = text;
  rule.path = rest.substr(0, colon);
  rule.kind = rest.substr(colon + 1, valueGiven ? equals - colon - 1 : rest.npos);
  if (valueGiven) rule.value = rest.substr(equals + 1);

  const auto* const kind = std::ranges::find(kKinds, std::string_view(rule.kind), &Kind::name);
  if (kind == kKinds.end()) return refuse(fmt::format("there is no kind \"{}\"", rule.kind));
  if (const auto reason = objection(*kind, valueGiven, rule.value)) return refuse(*reason);
  if (rule.kind == "version" && !covers(rule.path, "/bag")) return refuse("only /bag has a version");
  const std::lock_guard lock(mutex_);
  rules_.push_back(std::move(rule));
  return std::nullopt;
}

void Faults::clear() {
  const std::lock_guard lock(mutex_);
  rules_.clear();
}

ReadingPlan Faults::planReading(const std::string& path) {
  ReadingPlan plan;
  for (const Rule& rule : applying(path, true)) {
    const size_t value = number(rule.value).value_or(0);
    (rule.kind == "reset-body" ? plan.resetAfter : plan.bytesPerSecond) = value;
  }
  return plan;
}

FaultPlan Faults::plan(const std::string& path) {
  FaultPlan plan;
  for (const Rule& rule : applying(path, false)) note(rule, plan);
  return plan;
}

std::vector<Faults::Rule> Faults::applying(const std::string& path, bool reading) {
  std::vector<Rule> result;
  const std::lock_guard lock(mutex_);
  for (auto& rule : rules_) {
    if (rule.kind.ends_with("-body") != reading || !covers(rule.path, path)) continue;
    if (rule.skip > 0) {
      --rule.skip;
      continue;
    }
    if (rule.count && (*rule.count)-- == 0) {
      rule.count = 0;
      continue;
    }
    result.push_back(rule);
  }
  return result;
}

void Faults::note(const Rule& rule, FaultPlan& plan) {
  plan.rules.push_back(rule.text);
  const size_t value = number(rule.value).value_or(0);
  if (rule.kind == "latency")
    plan.latency = std::chrono::milliseconds(value);
  else if (rule.kind == "status")
    plan.status = static_cast<int>(value);
  else if (rule.kind == "truncate")
    plan.truncateAfter = value;
  else if (rule.kind == "slow")
    plan.bytesPerSecond = value;
  else if (rule.kind == "redirect")
    plan.redirect = rule.value;
  else if (rule.kind == "body")
    plan.body = rule.value;
  else if (rule.kind == "retry-after")
    plan.retryAfter = rule.value;
  else if (rule.kind == "version")
    plan.bagVersion = rule.value;
  else
    plan.reset = true;
}

void FaultPlan::apply(Answer& answer) const {
  if (refuses()) {
    const int code = status.value_or(redirect ? 302 : 503);
    Json record = std::move(answer.record);
    answer = Answer::error(code, "a fault was asked for");
    answer.record = std::move(record);
  }
  if (redirect) answer.headers.emplace_back("Location", *redirect);
  if (retryAfter) answer.headers.emplace_back("Retry-After", *retryAfter);
  if (!body) return;
  answer.body = *body;
  answer.zeros = 0;
}

}  // namespace service

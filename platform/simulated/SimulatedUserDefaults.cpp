#include "platform/simulated/SimulatedUserDefaults.h"

#include <nlohmann/json.hpp>

#include "platform/Log.h"

namespace sable::platform::simulated {

namespace {

template <class Result>
std::optional<Result> as(const Dictionary* value) {
  return value == nullptr ? std::nullopt : std::optional<Result>(value->get<Result>());
}

}  // namespace

template <class Is>
const SimulatedUserDefaults::Value* SimulatedUserDefaults::find(std::string_view key, std::string_view type,
                                                                Is is) const {
  for (const auto& layer : layers_) {
    const auto found = layer.find(key);
    if (found == layer.end()) continue;
    if (is(found->second)) return &found->second;
    if (reported_.emplace(key).second) platformLog().error("{} is not {}; it counts as absent", key, type);
  }
  return nullptr;
}

void SimulatedUserDefaults::put(Layer layer, std::string_view key, const Dictionary& value) {
  auto& entries = layers_[layer];
  if (value.is_null()) {
    entries.erase(std::string(key));
  } else {
    entries.insert_or_assign(std::string(key), Value{std::make_shared<const Dictionary>(value), {}});
  }
}

void SimulatedUserDefaults::registerDefaults(const Dictionary& object) {
  for (const auto& [key, value] : object.items()) put(registered, key, value);
}

std::optional<bool> SimulatedUserDefaults::boolean(std::string_view key) const {
  const Value* found = find(key, "a boolean", [](const Value& v) { return v.value->is_boolean(); });
  return as<bool>(found == nullptr ? nullptr : found->value.get());
}

std::optional<std::int64_t> SimulatedUserDefaults::integer(std::string_view key) const {
  const Value* found = find(key, "an integer", [](const Value& v) { return v.value->is_number_integer(); });
  return as<std::int64_t>(found == nullptr ? nullptr : found->value.get());
}

std::optional<double> SimulatedUserDefaults::number(std::string_view key) const {
  const Value* found = find(key, "a number", [](const Value& v) { return v.value->is_number() && !v.date; });
  return as<double>(found == nullptr ? nullptr : found->value.get());
}

std::optional<std::string> SimulatedUserDefaults::string(std::string_view key) const {
  const Value* found = find(key, "a string", [](const Value& v) { return v.value->is_string(); });
  return as<std::string>(found == nullptr ? nullptr : found->value.get());
}

std::optional<WallTime> SimulatedUserDefaults::date(std::string_view key) const {
  const Value* found = find(key, "a date", [](const Value& v) { return v.date.has_value(); });
  return found == nullptr ? std::nullopt : found->date;
}

std::optional<Dictionary> SimulatedUserDefaults::array(std::string_view key) const {
  const Value* found = find(key, "an array", [](const Value& v) { return v.value->is_array(); });
  return found == nullptr ? std::nullopt : std::optional(*found->value);
}

std::optional<Dictionary> SimulatedUserDefaults::dictionary(std::string_view key) const {
  const Value* found = find(key, "a table", [](const Value& v) { return v.value->is_object(); });
  return found == nullptr ? std::nullopt : std::optional(*found->value);
}

std::optional<bool> SimulatedUserDefaults::sharedBoolean(std::string_view domain,
                                                         std::string_view key) const {
  const auto found = shared_.find({std::string(domain), std::string(key)});
  return found == shared_.end() ? std::nullopt : std::optional(found->second);
}

void SimulatedUserDefaults::set(std::string_view key, const Dictionary& value) {
  put(own, key, value);
}

void SimulatedUserDefaults::setDate(std::string_view key, WallTime value) {
  layers_[own].insert_or_assign(std::string(key),
                                Value{std::make_shared<const Dictionary>(secondsSince1970(value)), value});
}

}  // namespace sable::platform::simulated

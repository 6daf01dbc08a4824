#include "sabled/RequestTrace.h"

#include <algorithm>

namespace sable {

void RequestTrace::beginStep(std::string_view step) {
  steps_.emplace_back(step);
}

void RequestTrace::noteForced(Place place, std::string_view name, std::string_view value,
                              const std::optional<std::string>& found) {
  note(place, name, value, found, Effect::replaced);
}

void RequestTrace::noteDefault(Place place, std::string_view name, std::string_view value,
                               const std::optional<std::string>& found) {
  note(place, name, value, found, Effect::kept);
}

void RequestTrace::note(Place place, std::string_view name, std::string_view value,
                        const std::optional<std::string>& found, Effect effectWhenFound) {
  Entry entry{.place = place,
              .step = steps_.empty() ? std::string() : steps_.back(),
              .name = std::string(name),
              .value = std::string(value),
              .effect = Effect::set,
              .otherStep = {},
              .otherValue = {}};
  if (found) {
    entry.effect = effectWhenFound;
    entry.otherStep = holderOf(place, name);
    entry.otherValue = *found;
  }
  entries_.push_back(std::move(entry));
}

std::string RequestTrace::holderOf(Place place, std::string_view name) const {
  const auto holder = std::find_if(entries_.rbegin(), entries_.rend(), [&](const Entry& entry) {
    return entry.place == place && entry.name == name && entry.effect != Effect::kept;
  });
  return holder == entries_.rend() ? std::string() : holder->step;
}

std::vector<std::string> RequestTrace::silentSteps() const {
  std::vector<std::string> silent;
  for (const std::string& step : steps_) {
    const bool spoke = std::ranges::any_of(entries_, [&](const Entry& entry) { return entry.step == step; });
    if (!spoke) silent.push_back(step);
  }
  return silent;
}

}  // namespace sable

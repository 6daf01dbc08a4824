#include "platform/host/HostActivityScheduler.h"

#include <cerrno>
#include <nlohmann/json.hpp>
#include <utility>

#include "platform/Dictionary.h"
#include "platform/Log.h"
#include "platform/host/PowerSupply.h"

namespace sable::platform::host {

namespace {

constexpr const char* kLastRun = "last_run";
constexpr const char* kNextRun = "next_run";

std::optional<WallTime> timeMember(const Dictionary& times, const char* name) {
  /// A double that fits no WallTime comes from no clock.
  constexpr double kYear2200 = 7258118400;
  const auto seconds = numberMember(times, name);
  if (!seconds || !(*seconds >= 0 && *seconds <= kYear2200)) return std::nullopt;
  return wallTimeFromSecondsSince1970(*seconds);
}

}  // namespace

std::string encodeActivityRecord(const ActivityRecord& record) {
  Dictionary all = Dictionary::object();
  for (const auto& [identifier, times] : record) {
    Dictionary& one = all[identifier] = Dictionary::object();
    if (times.lastRun) one[kLastRun] = secondsSince1970(*times.lastRun);
    if (times.nextRun) one[kNextRun] = secondsSince1970(*times.nextRun);
  }
  return compactJSON(all);
}

ActivityRecord decodeActivityRecord(std::string_view text) {
  const auto all = parseJSON(text, kMaximumActivityRecordBytes);
  if (!all || !all->is_object()) return {};
  ActivityRecord record;
  for (const auto& [identifier, times] : all->items()) {
    if (times.is_object()) record[identifier] = {timeMember(times, kLastRun), timeMember(times, kNextRun)};
  }
  return record;
}

HostActivityScheduler::HostActivityScheduler(Runtime& runtime, NotificationCenter& center,
                                             const HostFacts& facts, FileManager& fileManager,
                                             std::filesystem::path file)
    : host_(facts, fileManager, std::move(file)), scheduler_(runtime, center, host_) {}

void HostActivityScheduler::registerActivity(std::string identifier, const ActivityCriteria& criteria,
                                             Handler handler) {
  scheduler_.registerActivity(std::move(identifier), criteria, std::move(handler));
}

void HostActivityScheduler::unregister(std::string_view identifier) {
  scheduler_.unregister(identifier);
}

HostActivityScheduler::Host::Host(const HostFacts& facts, FileManager& fileManager,
                                  std::filesystem::path file)
    : facts_(facts), fileManager_(fileManager), file_(std::move(file)) {}

bool HostActivityScheduler::Host::onBattery() {
  if (const auto fact = facts_.boolean("on_battery")) return *fact;
  return runsOnBattery(facts_.sources().root);
}

ActivityRecord HostActivityScheduler::Host::load() {
  const auto text = fileManager_.read(file_, kMaximumActivityRecordBytes);
  if (text) return decodeActivityRecord(*text);
  if (text.error().code != ENOENT) platformLog().error("activities: {}", text.error().description());
  return {};
}

void HostActivityScheduler::Host::save(const ActivityRecord& record) {
  const auto written = write(record);
  if (!written && !std::exchange(failureLogged_, true))
    platformLog().error("runs of activities are not kept: {}", written.error().description());
}

Expected<void> HostActivityScheduler::Host::write(const ActivityRecord& record) {
  if (auto made = fileManager_.createDirectory(file_.parent_path()); !made) return made;
  return fileManager_.writeAtomically(file_, encodeActivityRecord(record));
}

}  // namespace sable::platform::host

#include "platform/host/HostSubscriptionRegistry.h"

#include <algorithm>
#include <nlohmann/json.hpp>

namespace sable::platform::host {

namespace {

using Path = std::filesystem::path;

constexpr std::string_view kKey = "subscriptions";

void append(const Dictionary& tables, std::vector<Subscription>& all) {
  for (const Dictionary& table : tables) {
    all.push_back({stringMember(table, "provider").value_or(""), stringMember(table, "domain").value_or(""),
                   stringMember(table, "info"),
                   wallTimeFromSecondsSince1970(numberMember(table, "modified").value_or(0))});
  }
}

bool has(const std::vector<std::string>& list, const std::string& item) {
  return std::ranges::find(list, item) != list.end();
}

}  // namespace

HostSubscriptionRegistry::HostSubscriptionRegistry(const Folders& folders, const HostFacts& facts,
                                                   Runtime& runtime, Reactor& reactor,
                                                   NotificationCenter& notificationCenter)
    : folders_{folders.systemSubscriptions(), folders.userSubscriptions()},
      facts_(facts),
      reactor_(reactor),
      notificationCenter_(notificationCenter),
      queue_(runtime.serialQueue("com.kestrel.sabled.subscriptionRegistry", QualityOfService::background)) {}

HostSubscriptionRegistry::~HostSubscriptionRegistry() {
  queue_->sync([] {});
}

void HostSubscriptionRegistry::watch() {
  if (watcher_ != nullptr) return;
  std::vector<Path> watched;
  for (const Path& folder : folders_) watched.push_back(folder / "");
  watcher_ = std::make_unique<FileWatcher>(reactor_, std::move(watched), [this] {
    if (reload()) notificationCenter_.post({kSubscriptionRegistryDidUpdateNotification, this, {}});
  });
  reload();
}

std::vector<Path> HostSubscriptionRegistry::paths() const {
  std::vector<Path> all;
  for (const Path& folder : folders_) std::ranges::copy(tomlFilesIn(folder), std::back_inserter(all));
  return all;
}

bool HostSubscriptionRegistry::reload() {
  const std::lock_guard lock(mutex_);
  std::vector<FactsFile> before = std::exchange(files_, {});
  bool changed = false;
  for (const Path& path : paths()) {
    const auto known = std::ranges::find(before, path, &FactsFile::path);
    files_.push_back(known == before.end() ? FactsFile(path) : std::move(*known));
    changed = files_.back().reload() || changed;
    if (known != before.end()) before.erase(known);
  }
  return changed || !before.empty();
}

std::vector<Subscription> HostSubscriptionRegistry::all() {
  std::vector<Subscription> all;
  {
    const std::lock_guard lock(mutex_);
    for (const FactsFile& file : files_) {
      const auto found = file.facts().find(kKey);
      if (found != file.facts().end()) append(*found->second.value, all);
    }
  }
  if (const auto tables = facts_.tables(kKey)) append(*tables, all);
  return all;
}

void HostSubscriptionRegistry::activeSubscriptions(
    std::vector<std::string> providers, std::vector<std::string> domains,
    Function<void(Expected<std::vector<Subscription>>)> answer) {
  queue_->async([this, providers = std::move(providers), domains = std::move(domains),
                 answer = std::move(answer)]() mutable {
    watch();
    auto found = all();
    std::erase_if(found, [&](const Subscription& each) {
      return !has(providers, each.provider) && !has(domains, each.domain);
    });
    answer(std::move(found));
  });
}

}  // namespace sable::platform::host

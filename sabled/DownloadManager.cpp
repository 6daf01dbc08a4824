#include "sabled/DownloadManager.h"

#include <algorithm>
#include <cerrno>
#include <nlohmann/json.hpp>
#include <utility>

#include "SableKit/SBLBag.h"
#include "SableKit/SBLConstants.h"
#include "SableKit/SBLError.h"
#include "platform/UserDefaults.h"
#include "sabled/Assembly.h"
#include "sabled/Lookup.h"
#include "sabled/SBLNetworkRequestFactory.h"
#include "sabled/SableBagController.h"
#include "sabled/SableLogging.h"

namespace sable {
namespace {

constexpr std::string_view kDownloadResources = "download_resources";
constexpr std::string_view kDownloadResourcesList = "download_resources_list";

/// A new bag comes at start-up and with the user's first search, which have better use for the network.
constexpr platform::Duration kDownloadDelay = std::chrono::seconds(60);

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategoryDownloadManager);
}

}  // namespace

DownloadManager::DownloadManager(Assembly& assembly)
    : assembly_(assembly), queue_(assembly.runtime.serialQueue("com.kestrel.sable.DownloadManager")) {
  assembly_.downloadSessionDelegate = this;
  auto& center = assembly_.notificationCenter;
  observations_.push_back(
      center.observe(std::string(kSBLBagChangeNotification),
                     [this](const platform::Notification& posted) { bagChangeNotification(posted); }));
  observations_.push_back(
      center.observe(std::string(kSBLSignificantLocationChangeNotification),
                     [this](const platform::Notification&) { _handleSignificantLocationChange(); }));
}

DownloadManager::~DownloadManager() = default;

void DownloadManager::_start() {
  if (hasStarted_.exchange(true)) return;
  log().standard("started");
  queue_->async([this] { _loadResources(); });
}

void DownloadManager::bagChangeNotification(const platform::Notification& notification) {
  const auto bag = bagFromNotification(notification);
  log().standard("bag change: {}", bag == nullptr ? "(null)" : bag->version());
  if (bag == nullptr) return;
  _start();
  queue_->async([this, rawBag = bag->rawBag()] { _downloadBagResources(rawBag); });
}

bool DownloadManager::_isLookupResource(std::string_view identifier) {
  return identifier == kSBLLookupHintsWeekly || identifier == kSBLLookupHintsMonthly;
}

std::map<std::string, std::string> DownloadManager::resourceVersions() {
  _start();
  return queue_->sync([this] {
    std::map<std::string, std::string> versions;
    for (const auto& [identifier, resource] : resources_) {
      if (std::string version = _resourceVersion(identifier); !version.empty())
        versions.emplace(identifier, std::move(version));
    }
    return versions;
  });
}

std::optional<DownloadResource> DownloadManager::resourceForKey(const std::string& identifier) {
  return queue_->sync([&] {
    const auto found = resources_.find(identifier);
    return found == resources_.end() ? std::nullopt : std::optional(found->second);
  });
}

Expected<std::unique_ptr<platform::ReadableFile>> DownloadManager::fileHandleForResource(
    const std::string& identifier, platform::FileAttributes& attributes) {
  const auto path = _pathToResource(identifier);
  if (!path)
    return tl::unexpected(makeSBLError(SBLErrorCode::daemonSide, "no place for a resource of that name"));
  auto file = assembly_.fileManager.openForReading(*path);
  if (!file) return file;
  const auto known = (*file)->attributes();
  if (!known) return tl::unexpected(known.error());
  attributes = *known;
  return file;
}

void DownloadManager::_handleSignificantLocationChange() {
  _start();
  queue_->async([this] {
    _deleteResource(std::string(kSBLLookupHintsWeekly), false);
    _deleteResource(std::string(kSBLLookupHintsMonthly), false);
  });
}

void DownloadManager::_loadResources() {
  queue_->assertIsCurrent();
  const auto saved = assembly_.userDefaults.dictionary(kDownloadResources);
  if (!saved) return;
  for (const auto& [identifier, entry] : saved->items()) {
    if (!isResourceIdentifier(identifier)) continue;
    resources_.try_emplace(identifier, DownloadResource{identifier, stringMember(entry, "url").value_or(""),
                                                        stringMember(entry, "redirect_url").value_or("")});
  }
}

void DownloadManager::_saveResources() {
  queue_->assertIsCurrent();
  Dictionary saved = Dictionary::object();
  for (const auto& [identifier, resource] : resources_) {
    if (resource.url.empty()) continue;
    Dictionary entry = {{"url", resource.url}};
    if (!resource.redirectUrl.empty()) entry["redirect_url"] = resource.redirectUrl;
    try {
      static_cast<void>(entry.dump());  // settings are UTF-8, a redirect from afar need not be
      saved[identifier] = std::move(entry);
    } catch (const Dictionary::exception& exception) {
      log().error("exception saving resource {}: {}", identifier, exception.what());
    }
  }
  // Most bags change nothing.
  if (assembly_.userDefaults.dictionary(kDownloadResources).value_or(Dictionary::object()) == saved) return;
  assembly_.userDefaults.set(kDownloadResources, saved);
  assembly_.userDefaults.synchronize();
}

void DownloadManager::_downloadBagResources(const std::shared_ptr<const Dictionary>& rawBag) {
  queue_->assertIsCurrent();
  delayed_.clear();
  // The queue does not wait for the list: the session delivers it behind the end of a download, and
  // that waits for this queue.
  assembly_.downloadURLSession().getAllTasks([this, rawBag, generation = ++generation_](Tasks tasks) {
    queue_->async([this, rawBag, generation, tasks = std::move(tasks)] {
      for (const auto& task : tasks) {
        log().standard("canceling {}", task.currentURL);
        assembly_.downloadURLSession().cancel(task.identifier);
      }
      if (generation == generation_) addBagResources(*rawBag);
    });
  });
}

void DownloadManager::addBagResources(const Dictionary& rawBag) {
  queue_->assertIsCurrent();
  const auto list = stringsMember(rawBag, kDownloadResourcesList);
  log().standard("resource files to be downloaded: {}", list ? compactJSON(*list) : "(null)");
  if (!list) return;  // a bag that says nothing costs no file
  for (const std::string& identifier : *list) {
    if (!isResourceIdentifier(identifier)) {
      log().error("{} is no name for a resource, not downloading", identifier);
    } else if (!_resourceDownloadAllowed(identifier)) {
      log().standard("{} is disabled, not downloading", identifier);
    } else {
      log().standard("downloading file: {} ", identifier);  // with the blank: log readers match this line
      _addResource(identifier, stringMember(rawBag, identifier));
    }
  }
  std::vector<std::string> dropped;
  for (const auto& [identifier, resource] : resources_) {
    if (std::ranges::find(*list, identifier) == list->end()) dropped.push_back(identifier);
  }
  for (const std::string& identifier : dropped) _deleteResource(identifier, true);
  _saveResources();
}

bool DownloadManager::_resourceDownloadAllowed(std::string_view identifier) const {
  if (!_isLookupResource(identifier)) return true;
  return assembly_.lookup != nullptr && assembly_.lookup->lookupEnabled();
}

void DownloadManager::_addResource(const std::string& identifier, const std::optional<std::string>& url) {
  queue_->assertIsCurrent();
  const auto comparable = url ? urlForCompare(*url) : std::nullopt;
  if (!comparable) return _deleteResource(identifier, true);
  const auto& resource =
      resources_.try_emplace(identifier, DownloadResource{identifier, {}, {}}).first->second;
  const char* reason = reasonForDownload(resource, *comparable);
  if (reason == nullptr) return;
  Delayed& delayed = delayed_[identifier];
  delayed.due = assembly_.runtime.ticks() + kDownloadDelay;
  delayed.reason = reason;
  delayed.timer = queue_->after(kDownloadDelay, [this, identifier, url = *url, reason = std::string(reason)] {
    _downloadResource(identifier, url, reason);
  });
}

/// Null: what is there will do.
const char* DownloadManager::reasonForDownload(const DownloadResource& resource, const std::string& url) {
  if (resource.url != url) return "update";
  const auto path = _pathToResource(resource.identifier);
  if (!path || !assembly_.fileManager.attributes(*path)) return "missing";
  // The service decides by the version that it is told whether there are other hints by now.
  return _isLookupResource(resource.identifier) ? "lookup" : nullptr;
}

std::string DownloadManager::_resourceVersion(const std::string& identifier) const {
  queue_->assertIsCurrent();
  const auto found = resources_.find(identifier);
  if (found == resources_.end()) return {};
  const DownloadResource& resource = found->second;
  if (_isLookupResource(identifier) && !resource.redirectUrl.empty())
    return Lookup::signatureFromURL(resource.redirectUrl);
  return versionFromURL(resource.url);
}

void DownloadManager::_deleteResource(const std::string& identifier, bool removeFile) {
  queue_->assertIsCurrent();
  log().standard("deleting resource: {}", identifier);
  resources_.erase(identifier);
  delayed_.erase(identifier);
  _saveResources();
  assembly_.downloadURLSession().getAllTasks([this, identifier](const Tasks& tasks) {
    for (const auto& task : tasks) {
      if (identifierOf(task) == identifier) assembly_.downloadURLSession().cancel(task.identifier);
    }
  });
  if (removeFile) removeFileOf(identifier);
}

void DownloadManager::removeFileOf(const std::string& identifier) {
  if (const auto path = _pathToResource(identifier); !path) {
    log().error("error trying to get path to file for deletion {}", identifier);
  } else if (const auto removed = assembly_.fileManager.remove(*path);
             !removed && removed.error().code != ENOENT) {
    log().error("error trying to remove file at url {}: {}", path->string(), removed.error().description());
  }
  assembly_.notificationCenter.post({kSBLFileDeletedNotification, this, {{"identifier", identifier}}});
}

std::optional<std::filesystem::path> DownloadManager::cacheDirectory() const {
  const auto caches = assembly_.fileManager.cachesDirectory();
  if (caches) return *caches / kSBLSubsystem;
  log().error("error getting cache directory {}", caches.error().description());
  return std::nullopt;
}

std::optional<std::filesystem::path> DownloadManager::_pathToResource(std::string_view identifier) const {
  const auto directory = cacheDirectory();
  if (!directory) log().error("error caches directory is nil");
  if (identifier.empty()) log().error("error resource bag key is nil");
  if (!directory || identifier.empty()) return std::nullopt;
  if (isResourceIdentifier(identifier)) return *directory / identifier;
  log().error("{} is no name for a resource", identifier);
  return std::nullopt;
}

}  // namespace sable

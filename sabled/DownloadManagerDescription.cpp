#include <algorithm>
#include <nlohmann/json.hpp>
#include <utility>

#include "sabled/Assembly.h"
#include "sabled/DownloadManager.h"

// What the table holds and what is planned, for people.
namespace sable {

void DownloadManager::describeResources(platform::Function<void(Dictionary)> completion) {
  _start();
  assembly_.downloadURLSession().getAllTasks([this, completion = std::move(completion)](Tasks tasks) mutable {
    queue_->async([this, completion = std::move(completion), tasks = std::move(tasks)]() mutable {
      completion(description(tasks));
    });
  });
}

Dictionary DownloadManager::description(const Tasks& tasks) const {
  queue_->assertIsCurrent();
  Dictionary descriptions = Dictionary::array();
  for (const auto& [identifier, resource] : resources_) descriptions.push_back(description(resource, tasks));
  return descriptions;
}

Dictionary DownloadManager::description(const DownloadResource& resource, const Tasks& tasks) const {
  const auto orNull = [](const std::string& text) { return text.empty() ? Dictionary() : Dictionary(text); };
  const auto path = _pathToResource(resource.identifier);
  std::optional<platform::FileAttributes> file;
  if (path) {
    if (const auto known = assembly_.fileManager.attributes(*path)) file = *known;
  }
  Dictionary described;
  described["identifier"] = resource.identifier;
  described["version"] = orNull(_resourceVersion(resource.identifier));
  described["url"] = orNull(resource.url);
  described["redirect_url"] = orNull(resource.redirectUrl);
  described["size"] = file ? Dictionary(file->size) : Dictionary();
  described["created"] = file ? Dictionary(platform::secondsSince1970(file->creationDate)) : Dictionary();
  const auto delayed = delayed_.find(resource.identifier);
  const bool isOnItsWay =
      std::ranges::any_of(tasks, [&](const auto& task) { return identifierOf(task) == resource.identifier; });
  if (delayed != delayed_.end()) {
    described["state"] = "delayed";
    described["reason"] = delayed->second.reason;
    described["starts_in"] = platform::toSeconds(delayed->second.due - assembly_.runtime.ticks());
  } else {
    described["state"] = isOnItsWay ? "in flight" : file ? "there" : "missing";
  }
  return described;
}

}  // namespace sable

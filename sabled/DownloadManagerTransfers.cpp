#include <fmt/format.h>

#include <any>
#include <nlohmann/json.hpp>

#include "SableKit/SBLConstants.h"
#include "SableKit/SBLError.h"
#include "platform/Tally.h"
#include "sabled/Assembly.h"
#include "sabled/ClientSessionManager.h"
#include "sabled/DownloadManager.h"
#include "sabled/SBLNetworkRequestFactory.h"
#include "sabled/SableLogging.h"

// Downloads on their way: asked for, arrived, ended.
namespace sable {

using platform::HTTPBackgroundTask;
using platform::HTTPRequest;

namespace {

/// Tells the service which resource is asked for, and the manager which one has come.
constexpr std::string_view kIdentifierHeader = "X-Kestrel-Download-Identifier";

/// Within which the platform may choose the time.
constexpr platform::Duration kDownloadWindow = std::chrono::seconds(86400);

constexpr std::string_view kResourceFilesFetched = "com.kestrel.sabled.resourcefilesfetched";

const platform::LogHandle& log() {
  return SableLogForCategory(SableLoggingCategoryDownloadManager);
}

bool isCancelled(const std::optional<Error>& error) {
  return error && error->domain == platform::kHTTPErrorDomain &&
         error->code == static_cast<std::int64_t>(platform::HTTPErrorCode::cancelled);
}

/// Whether an answer stands for a file: the one it brings, or the one the device has.
bool isFile(int status) {
  return status == 200 || status == 304;
}

}  // namespace

std::string DownloadManager::identifierOf(const HTTPBackgroundTask& task) {
  const std::string* identifier = task.originalRequest.headers.find(kIdentifierHeader);
  return identifier == nullptr ? std::string() : *identifier;
}

void DownloadManager::reportError(std::string reason) {
  ClientSessionManager::reportErrorAsSabledFeedback(makeSBLError(SBLErrorCode::daemonSide, std::move(reason)),
                                                    assembly_);
}

HTTPRequest DownloadManager::_createDownloadRequest(const std::string& identifier, const std::string& url) {
  HTTPRequest request = assembly_.requestFactory->fileDownloadRequest(url, _resourceVersion(identifier),
                                                                      _isLookupResource(identifier));
  request.headers.set(kIdentifierHeader, identifier);
  return request;
}

void DownloadManager::_downloadResource(const std::string& identifier, const std::string& url,
                                        const std::string& reason) {
  queue_->assertIsCurrent();
  const HTTPRequest request = _createDownloadRequest(identifier, url);
  log().standard("starting download of {} reason: {} delay: {:f} headers: {}", identifier, reason,
                 platform::toSeconds(kDownloadWindow), request.headers.description());
  auto& session = assembly_.downloadURLSession();
  const auto task = session.downloadTask(request, identifier, kDownloadWindow);
  delayed_.erase(identifier);
  if (task) return session.resume(*task);
  log().error("download task error {}", task.error().description());
  reportDownloadError(task.error());
}

void DownloadManager::didCompleteWithError(const HTTPBackgroundTask& task,
                                           const std::optional<Error>& error) {
  if (isCancelled(error)) return;
  if (task.response && !isFile(task.response->status))
    reportError(fmt::format("status code {}", task.response->status));
  if (task.originalRequest.url.empty()) {
    return log().error("task completed with nil url and error: {}", error ? error->description() : "(null)");
  }
  if (error) {
    log().error("download task error {}", error->description());
    return reportDownloadError(*error);
  }
  _start();
  queue_->sync([&] { noteCompletion(task); });
}

void DownloadManager::reportDownloadError(const Error& error) {
  reportError(fmt::format("download error {} {}", error.domain, error.code));
}

// A status that is an error completes a download, too: services count on not being asked again for what
// they refuse until the bag names another URL, or the file is missing.
void DownloadManager::noteCompletion(const HTTPBackgroundTask& task) {
  queue_->assertIsCurrent();
  const std::string identifier = identifierOf(task);
  const auto found = resources_.find(identifier);
  if (found == resources_.end()) {
    log().error("could not find resource for download identifier: {} url: {}", identifier, task.currentURL);
    return reportError("can't find " + identifier);
  }
  DownloadResource& resource = found->second;
  resource.url = urlForCompare(task.originalRequest.url).value_or("");
  const std::string current = urlForCompare(task.currentURL).value_or(resource.url);
  const int status = task.response ? task.response->status : 0;
  // The place of an error page is no version; that nothing has changed may be said without a redirect.
  if (current != resource.url && isFile(status)) resource.redirectUrl = current;
  if (current == resource.url && status == 200) resource.redirectUrl.clear();
  log().standard("{} url: {}", identifier, resource.url);
  assembly_.tally.add(kResourceFilesFetched, 1);
  _saveResources();
}

void DownloadManager::didFinishDownloadingToURL(const HTTPBackgroundTask& task,
                                                const std::filesystem::path& location) {
  const int status = task.response ? task.response->status : 0;
  if (status >= 400) return log().error("download of {} got a {} response", identifierOf(task), status);
  if (status != 200) return;
  _start();
  log().standard("download of {} finished {}", identifierOf(task), task.currentURL);
  queue_->sync([&] { storeFile(task, location); });
}

void DownloadManager::storeFile(const HTTPBackgroundTask& task, const std::filesystem::path& location) {
  queue_->assertIsCurrent();
  const std::string identifier = identifierOf(task);
  if (!resources_.contains(identifier)) {
    return log().error("failed to find download for identifier: {} url: {}", identifier, task.currentURL);
  }
  const auto destination = _pathToResource(identifier);
  if (!destination) return log().error("failed getting destination URL for {}", identifier);
  auto replaced = assembly_.fileManager.createDirectory(destination->parent_path());
  if (replaced) replaced = assembly_.fileManager.replaceItem(*destination, location);
  if (!replaced) return log().error("error copying download {}", replaced.error().description());
  // Counted here and once more when the task has completed: readers of the counter know it so.
  assembly_.tally.add(kResourceFilesFetched, 1);
  assembly_.notificationCenter.post(
      {kSBLFileDownloadCompletedNotification, this, {{"identifier", identifier}, {"url", *destination}}});
}

}  // namespace sable

#include "platform/host/HostTransferHost.h"

#include <sys/stat.h>

#include "platform/host/CurlTransfer.h"

namespace sable::platform::host {
namespace {

HTTPSessionConfiguration attemptsOf(const HTTPBackgroundSessionConfiguration& configuration) {
  HTTPSessionConfiguration attempts;
  attempts.label = configuration.identifier + ".attempts";
  attempts.maximumResponseBytes = configuration.maximumDownloadBytes;
  attempts.idleConnectionTimeout = std::chrono::seconds(10);
  return attempts;
}

}  // namespace

HostTransferHost::HostTransferHost(HostRuntime& runtime, std::shared_ptr<TransferStore> store,
                                   std::function<TransferConditions()> conditions,
                                   const HTTPBackgroundSessionConfiguration& configuration)
    : runtime_(runtime),
      store_(std::move(store)),
      conditions_(std::move(conditions)),
      session_(configuration.identifier),
      requestTimeout_(configuration.requestTimeout),
      resourceTimeout_(configuration.resourceTimeout),
      attempts_(runtime, attemptsOf(configuration), {}) {}

void HostTransferHost::noteReported(const BackgroundTransfer& transfer) {
  store_->noteReported(session_, transfer, runtime_.now() - resourceTimeout_);
}

std::filesystem::path HostTransferHost::download(std::int64_t identifier) {
  auto path = store_->part(identifier);
  std::error_code error;
  return std::filesystem::exists(path, error) ? path : std::filesystem::path();
}

std::shared_ptr<HTTPDataTask> HostTransferHost::attempt(const BackgroundTransfer& transfer, Progress progress,
                                                        HTTPSession::Completion completion) {
  const HTTPBackgroundTask& task = transfer.task;
  const bool upload = task.kind == HTTPBackgroundTaskKind::upload;
  auto file = upload ? store_->openBody(task.identifier) : store_->openPart(task.identifier);
  TransferFiles files;
  struct stat status {};
  if (!file) {
    files.error = file.error();
  } else if (upload && fstat(file->number(), &status) == 0) {
    files.bodyBytes = status.st_size;
    files.body = std::move(*file);
  } else {
    files.sink = std::move(*file);
  }
  files.progress = std::move(progress);
  HTTPRequest request = task.originalRequest;
  request.timeout = toSeconds(requestTimeout_);
  return attempts_.fileTask(std::move(request), std::move(files), std::move(completion));
}

}  // namespace sable::platform::host

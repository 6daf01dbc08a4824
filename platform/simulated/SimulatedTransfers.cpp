#include "platform/simulated/SimulatedTransfers.h"

#include <cerrno>

namespace sable::platform::simulated {
namespace {

const std::filesystem::path kSpool = "/var/spool/transfers";

std::filesystem::path fileOf(std::int64_t identifier) {
  return kSpool / std::to_string(identifier);
}

}  // namespace

std::vector<BackgroundTransfer> SimulatedTransferDisk::unreported(std::string_view session) const {
  std::vector<BackgroundTransfer> result;
  for (const auto& [identifier, kept] : transfers) {
    if (!kept.reported && (session.empty() || kept.session == session)) result.push_back(kept.transfer);
  }
  return result;
}

SimulatedTransferHost::SimulatedTransferHost(std::shared_ptr<SimulatedTransferDisk> disk, FileManager& files,
                                             std::unique_ptr<HTTPSession> attempts,
                                             const HTTPBackgroundSessionConfiguration& configuration)
    : disk_(std::move(disk)),
      files_(files),
      attempts_(std::move(attempts)),
      session_(configuration.identifier),
      timeout_(toSeconds(configuration.requestTimeout)) {}

Expected<std::int64_t> SimulatedTransferHost::accept(const BackgroundTransfer& transfer,
                                                     std::string_view token,
                                                     const std::filesystem::path& body) {
  if (disk_->failure != 0) return tl::unexpected(posixError(disk_->failure, body.native()));
  SimulatedTransferDisk::Kept kept{session_, transfer, std::string(token), nullptr, false};
  if (transfer.task.kind == HTTPBackgroundTaskKind::upload) {
    auto bytes = files_.read(body, SIZE_MAX);
    if (!bytes) return tl::unexpected(bytes.error());
    kept.body = makeData(std::move(*bytes));
  }
  const std::int64_t identifier = disk_->transfers.empty() ? 1 : disk_->transfers.rbegin()->first + 1;
  kept.transfer.task.identifier = identifier;
  disk_->transfers.emplace(identifier, std::move(kept));
  return identifier;
}

void SimulatedTransferHost::note(const BackgroundTransfer& transfer) {
  disk_->transfers.at(transfer.task.identifier).transfer = transfer;
}

void SimulatedTransferHost::noteReported(const BackgroundTransfer& transfer) {
  auto& kept = disk_->transfers.at(transfer.task.identifier);
  kept.reported = true;
  kept.body = nullptr;
  static_cast<void>(files_.remove(fileOf(transfer.task.identifier)));
}

bool SimulatedTransferHost::hasAccepted(std::string_view token, WallTime since) {
  for (const auto& [identifier, kept] : disk_->transfers) {
    if (!token.empty() && kept.session == session_ && kept.token == token &&
        kept.transfer.accepted >= since) {
      return true;
    }
  }
  return false;
}

std::filesystem::path SimulatedTransferHost::download(std::int64_t identifier) {
  const auto file = fileOf(identifier);
  return files_.attributes(file) ? file : std::filesystem::path();
}

std::shared_ptr<HTTPDataTask> SimulatedTransferHost::attempt(const BackgroundTransfer& transfer,
                                                             Progress progress,
                                                             HTTPSession::Completion completion) {
  const auto& task = transfer.task;
  HTTPRequest request = task.originalRequest;
  request.timeout = timeout_;
  request.body = disk_->transfers.at(task.identifier).body;
  const auto size = request.body ? static_cast<std::int64_t>(request.body->size()) : 0;
  return attempts_->dataTask(
      std::move(request), [this, task, size, progress = std::move(progress),
                           completion = std::move(completion)](HTTPResult result) mutable {
        if (result.error) return completion(std::move(result));
        if (task.kind == HTTPBackgroundTaskKind::upload) {
          progress(size, size);
        } else if (files_.createDirectory(kSpool)) {
          static_cast<void>(files_.writeAtomically(fileOf(task.identifier), *result.data));
        }
        completion(std::move(result));
      });
}

}  // namespace sable::platform::simulated

#pragma once

#include <map>
#include <memory>
#include <string>

#include "platform/BackgroundTransfers.h"
#include "platform/FileManager.h"

namespace sable::platform::simulated {

/// What the background sessions of a device keep.
struct SimulatedTransferDisk {
  struct Kept {
    std::string session;
    BackgroundTransfer transfer;
    std::string token;
    Data body;
    bool reported = false;
  };

  std::map<std::int64_t, Kept> transfers;  // by identifier
  TransferConditions conditions;
  int failure = 0;  // errno value that accepting fails with

  /// Of one session, or of all for "".
  std::vector<BackgroundTransfer> unreported(std::string_view session) const;
};

/// Runs the background transfers of a simulated device over a session of data tasks.
class SimulatedTransferHost final : public BackgroundTransferHost {
 public:
  SimulatedTransferHost(std::shared_ptr<SimulatedTransferDisk> disk, FileManager& files,
                        std::unique_ptr<HTTPSession> attempts,
                        const HTTPBackgroundSessionConfiguration& configuration);

  std::vector<BackgroundTransfer> unreported() override { return disk_->unreported(session_); }
  Expected<std::int64_t> accept(const BackgroundTransfer& transfer, std::string_view token,
                                const std::filesystem::path& body) override;
  void note(const BackgroundTransfer& transfer) override;
  void noteReported(const BackgroundTransfer& transfer) override;
  bool hasAccepted(std::string_view token, WallTime since) override;
  std::filesystem::path download(std::int64_t identifier) override;
  void rest() override {}
  std::shared_ptr<HTTPDataTask> attempt(const BackgroundTransfer& transfer, Progress progress,
                                        HTTPSession::Completion completion) override;
  TransferConditions conditions() override { return disk_->conditions; }

 private:
  const std::shared_ptr<SimulatedTransferDisk> disk_;
  FileManager& files_;
  const std::unique_ptr<HTTPSession> attempts_;
  const std::string session_;
  const double timeout_;
};

}  // namespace sable::platform::simulated

#pragma once

#include <functional>
#include <memory>
#include <string>

#include "platform/BackgroundTransfers.h"
#include "platform/host/HostHTTPSession.h"
#include "platform/host/TransferStore.h"

namespace sable::platform::host {

/// Background transfers of one session on this machine: kept by a TransferStore, sent over a session of
/// data tasks whose bodies are files, so that none is ever whole in memory. A download is loaded anew at
/// each attempt.
class HostTransferHost final : public BackgroundTransferHost {
 public:
  HostTransferHost(HostRuntime& runtime, std::shared_ptr<TransferStore> store,
                   std::function<TransferConditions()> conditions,
                   const HTTPBackgroundSessionConfiguration& configuration);

  std::vector<BackgroundTransfer> unreported() override { return store_->unreported(session_); }
  Expected<std::int64_t> accept(const BackgroundTransfer& transfer, std::string_view token,
                                const std::filesystem::path& body) override {
    return store_->accept(session_, transfer, token, body);
  }
  void note(const BackgroundTransfer& transfer) override { store_->note(transfer); }
  void noteReported(const BackgroundTransfer& transfer) override;
  bool hasAccepted(std::string_view token, WallTime since) override {
    return store_->hasAccepted(session_, token, since);
  }
  std::filesystem::path download(std::int64_t identifier) override;
  void rest() override { store_->rest(); }
  std::shared_ptr<HTTPDataTask> attempt(const BackgroundTransfer& transfer, Progress progress,
                                        HTTPSession::Completion completion) override;
  TransferConditions conditions() override { return conditions_(); }

 private:
  const Runtime& runtime_;
  const std::shared_ptr<TransferStore> store_;
  const std::function<TransferConditions()> conditions_;
  const std::string session_;
  const Duration requestTimeout_;
  const Duration resourceTimeout_;
  HostHTTPSession attempts_;
};

}  // namespace sable::platform::host

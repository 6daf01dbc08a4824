#pragma once

#include <filesystem>
#include <memory>
#include <optional>

#include "platform/FileManager.h"
#include "sabled/OutputStream.h"

namespace sable {

/// Adds its bytes to a file that is there.
class FileOutputStream final : public OutputStream {
 public:
  FileOutputStream(platform::FileManager& fileManager, std::filesystem::path path)
      : fileManager_(fileManager), path_(std::move(path)) {}

  void open() override;
  std::ptrdiff_t write(std::string_view bytes) override;
  void close() override { file_.reset(); }
  StreamStatus streamStatus() const override;
  std::optional<Error> streamError() const override { return error_; }

 private:
  platform::FileManager& fileManager_;
  const std::filesystem::path path_;
  std::unique_ptr<platform::AppendableFile> file_;  ///< while it is open
  std::optional<Error> error_;
};

}  // namespace sable

#pragma once

#include <filesystem>
#include <memory>
#include <optional>
#include <string>

#include "platform/FileManager.h"
#include "sabled/OutputStream.h"

namespace sable {

/// Adds its bytes to a file that is there, many at a time: a failure may show at a later write, or when it is
/// closed.
class FileOutputStream final : public OutputStream {
 public:
  FileOutputStream(platform::FileManager& fileManager, std::filesystem::path path)
      : fileManager_(fileManager), path_(std::move(path)) {}

  void open() override;
  std::ptrdiff_t write(std::string_view bytes) override;
  void close() override;
  StreamStatus streamStatus() const override;
  std::optional<Error> streamError() const override { return error_; }

 private:
  bool writeBuffer();

  platform::FileManager& fileManager_;
  const std::filesystem::path path_;
  std::unique_ptr<platform::AppendableFile> file_;  ///< while it is open
  std::string buffer_;
  std::optional<Error> error_;
};

}  // namespace sable

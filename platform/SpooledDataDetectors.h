#pragma once

#include <filesystem>

#include "platform/DataDetectors.h"

namespace sable::platform {

class FileManager;

/// Stands in for the service: a folder from which a program that detects may take the files. In it,
/// by the number of the kind:
///
///     N            the source file, as it was given
///     N.signature  its signature, written after it: a process killed in between leaves an older one,
///                  by which the file's giver sees that it has to give it once more
class SpooledDataDetectors final : public DataDetectors {
 public:
  /// The folder is made (0700) when there is something to keep.
  SpooledDataDetectors(FileManager& fileManager, std::filesystem::path folder)
      : fileManager_(fileManager), folder_(std::move(folder)) {}

  Expected<void> pushSourceFile(ReadableFile& file, DataDetectorSource kind,
                                const std::string& signature) override;
  std::optional<std::string> clientSignature(DataDetectorSource kind) override;

 private:
  std::filesystem::path sourcePath(DataDetectorSource kind) const;
  std::filesystem::path signaturePath(DataDetectorSource kind) const;

  FileManager& fileManager_;
  const std::filesystem::path folder_;
};

}  // namespace sable::platform

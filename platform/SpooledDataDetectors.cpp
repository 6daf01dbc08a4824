#include "platform/SpooledDataDetectors.h"

#include "platform/FileManager.h"

namespace sable::platform {

namespace {

constexpr std::size_t kMaximumSourceBytes = 64u << 20;
constexpr std::size_t kMaximumSignatureBytes = 4096;

}  // namespace

std::filesystem::path SpooledDataDetectors::sourcePath(DataDetectorSource kind) const {
  return folder_ / std::to_string(static_cast<int>(kind));
}

std::filesystem::path SpooledDataDetectors::signaturePath(DataDetectorSource kind) const {
  return sourcePath(kind) += ".signature";
}

Expected<void> SpooledDataDetectors::pushSourceFile(ReadableFile& file, DataDetectorSource kind,
                                                    const std::string& signature) {
  const auto bytes = file.map(kMaximumSourceBytes);
  if (!bytes) return tl::unexpected(bytes.error());
  if (auto made = fileManager_.createDirectory(folder_); !made) return made;
  if (auto written = fileManager_.writeAtomically(sourcePath(kind), *bytes); !written) return written;
  return fileManager_.writeAtomically(signaturePath(kind), signature);
}

std::optional<std::string> SpooledDataDetectors::clientSignature(DataDetectorSource kind) {
  auto signature = fileManager_.read(signaturePath(kind), kMaximumSignatureBytes);
  return signature ? std::optional(*std::move(signature)) : std::nullopt;
}

}  // namespace sable::platform

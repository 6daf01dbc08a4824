#pragma once

#include <optional>
#include <string>

#include "platform/Error.h"

namespace sable::platform {

class ReadableFile;

/// What a source file is for. Numbers are of the detectors' own, and in the names of spooled files:
/// never renumber.
enum class DataDetectorSource : int { lookupHintsWeekly = 2, lookupHintsMonthly = 3 };

/// The service that finds dates, places and what can be looked up in the texts of applications. It
/// keeps one source file a kind, and beside it the signature of who gave it. Any thread.
class DataDetectors {
 public:
  virtual ~DataDetectors() = default;
  /// Takes a copy of the file's bytes in place of what it has of the kind. Fails for one of more than
  /// 64 MiB and where the copy cannot be kept; what there was stays then. Waits for the disk.
  virtual Expected<void> pushSourceFile(ReadableFile& file, DataDetectorSource kind,
                                        const std::string& signature) = 0;
  /// The signature that came with what it has of the kind; nullopt when it has nothing. Waits for the
  /// disk.
  virtual std::optional<std::string> clientSignature(DataDetectorSource kind) = 0;
};

}  // namespace sable::platform

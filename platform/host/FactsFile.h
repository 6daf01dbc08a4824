#pragma once

#include "platform/host/TOMLFile.h"

namespace sable::platform::host {

/// A file of facts, cleansed of those of the wrong type: each is reported with file, line and key,
/// and keeps the last good value it had here. Not synchronised.
class FactsFile {
 public:
  explicit FactsFile(std::filesystem::path path) : file_(std::move(path)) {}

  /// Reads the file again; whether the facts may be others now.
  bool reload();

  const std::filesystem::path& path() const { return file_.path(); }
  const TOMLContent& facts() const { return facts_; }
  bool isDamaged() const { return file_.isDamaged(); }

 private:
  TOMLFile file_;
  TOMLContent facts_;
};

}  // namespace sable::platform::host

#pragma once

#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Dictionary.h"
#include "platform/Runtime.h"

namespace sable::platform::host {

/// A top-level value of a TOML 1.0 file and where it stands. A date is in `date`, and in `value`
/// as seconds since 1970, as are dates inside arrays and tables; a local date-time counts as UTC.
struct TOMLValue {
  std::shared_ptr<const Dictionary> value;
  std::optional<WallTime> date;
  unsigned line = 0;
  unsigned column = 0;
};

using TOMLContent = std::map<std::string, TOMLValue, std::less<>>;

inline constexpr std::string_view kTOMLErrorDomain = "TOMLErrorDomain";

/// The error's code is the line, its reason "LINE:COLUMN: what".
Expected<TOMLContent> parseTOML(std::string_view text);

/// TOML has no null and no integer above INT64_MAX: the former is left out, the latter a double.
std::string formatTOML(const TOMLContent& content);

/// The text of a file that people write; "" when there is none, and whether it exists in `exists`.
/// Links of this user or root are followed (dotfiles often are links).
Expected<std::string> readTOMLText(const std::filesystem::path& path, bool* exists = nullptr);

/// The files *.toml in a folder, in the order of their names: at most 256, more are reported and left
/// out. None where there is no folder.
std::vector<std::filesystem::path> tomlFilesIn(const std::filesystem::path& folder);

/// A TOML file and its last good content. Not synchronised.
class TOMLFile {
 public:
  explicit TOMLFile(std::filesystem::path path) : path_(std::move(path)) {}

  /// Reads the file again; whether the content is another now. A missing file is empty. One that
  /// cannot be read or parsed is reported at error level, once, and the content stays.
  bool reload();

  const std::filesystem::path& path() const { return path_; }
  const TOMLContent& content() const { return content_; }
  bool isDamaged() const { return damaged_; }

 private:
  void report(std::string_view problem) const;

  std::filesystem::path path_;
  std::string text_;  ///< as last read, good or not
  TOMLContent content_;
  bool damaged_ = false;
};

}  // namespace sable::platform::host

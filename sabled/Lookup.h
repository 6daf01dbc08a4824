#pragma once

#include <filesystem>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/DataDetectors.h"
#include "platform/Dictionary.h"
#include "platform/NotificationCenter.h"
#include "platform/Runtime.h"

namespace sable {

namespace platform {
class Platform;
class ReadableFile;
}  // namespace platform

class Assembly;
struct SBLLookupRequest;

/// Lookups of selected text: which results fit the text around it, and the hint files by which the
/// device's data detectors know beforehand what a lookup would find. Each hint file that arrives is
/// handed to them with its version as signature; at start-up those are handed over once more whose
/// signature is not the version of what the daemon holds: a file that came while the detectors could
/// not take it, or whose version was known only after it. Any thread.
class Lookup {
 public:
  explicit Lookup(Assembly& assembly);
  ~Lookup();

  /// Whether the user wants lookup suggestions: not "LookupSuggestionsDisabled" of the domain
  /// "com.kestrel.lookup.shared". Read anew at each call; may block on the disk.
  bool lookupEnabled() const;

  /// Drops from a lookup's response, in place, the results whose instructions do not fit the request's
  /// context; docs/service.md has the rules. What has no instructions stays, and so does a response of
  /// another form. By the words and letter case of the device's locale, on the caller's queue.
  static void filterLookupResultsWithRequest(const SBLLookupRequest& request, Dictionary& response,
                                             platform::Platform& device);

  /// The words of a text in lower case, in order, as often as they occur.
  static std::vector<std::string> tokenize(std::string_view text, platform::Platform& device);

  /// The version of a hint file, from the URL that its download was redirected to: of a path
  /// /A/B/C/D, and whatever may follow, "C-D-B"; of a shorter one, and of what is no URL, "" (logged).
  static std::string signatureFromURL(std::string_view url);

  /// Waits for pending work.
  void _drainQueue();

 private:
  using Source = platform::DataDetectorSource;
  using Versions = std::map<std::string, std::string>;

  void _handleHintsFile(const platform::Notification& notification);
  void _reprocessHintsFiles();

  // On queue_.
  void _handleHintsFile(const std::optional<std::filesystem::path>& url, Source sourceKind);
  void _pushDDSourceFile(platform::ReadableFile& file, Source sourceKind, const std::string& version);
  void _reprocessHintsFile(Source sourceKind, const Versions& versions);
  Versions resourceVersions() const;

  Assembly& assembly_;
  const std::shared_ptr<platform::SerialQueue> queue_;
  std::vector<platform::NotificationCenter::Token> observations_;
};

}  // namespace sable

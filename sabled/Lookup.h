#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Dictionary.h"
#include "platform/Runtime.h"

namespace sable {

namespace platform {
class Platform;
}

class Assembly;
struct SBLLookupRequest;

/// Lookups of selected text, and which results fit the text around it. Any thread.
class Lookup {
 public:
  explicit Lookup(Assembly& assembly);

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
  Assembly& assembly_;
  const std::shared_ptr<platform::SerialQueue> queue_;
};

}  // namespace sable

#pragma once

#include <memory>
#include <string>
#include <string_view>

#include "platform/Runtime.h"

namespace sable {

class Assembly;

/// Lookups of selected text. Any thread.
class Lookup {
 public:
  explicit Lookup(Assembly& assembly);

  /// Whether the user wants lookup suggestions: not "LookupSuggestionsDisabled" of the domain
  /// "com.kestrel.lookup.shared". Read anew at each call; may block on the disk.
  bool lookupEnabled() const;

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

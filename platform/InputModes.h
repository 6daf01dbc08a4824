#pragma once

#include <optional>
#include <string>
#include <vector>

namespace sable::platform {

/// Keyboard input modes, "en_US@sw=QWERTY".
class InputModes {
 public:
  virtual ~InputModes() = default;
  /// The text-input preference with a number; 12 is the mode in use. Unknown numbers are nullopt.
  virtual std::optional<std::string> preference(int number) const = 0;
  /// The modes enabled by default for the current locale; never empty.
  virtual std::vector<std::string> defaultEnabledModes() const = 0;
};

}  // namespace sable::platform

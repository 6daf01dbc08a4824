#include "sabled/KeyboardLocale.h"

namespace sable {

std::string currentKeyboardInputMode(const platform::InputModes& inputModes) {
  constexpr int kModeInUse = 12;
  if (auto mode = inputModes.preference(kModeInUse)) return *mode;
  return inputModes.defaultEnabledModes().front();
}

}  // namespace sable

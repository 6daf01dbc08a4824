#pragma once

#include <string>

#include "platform/InputModes.h"

namespace sable {

/// The keyboard's input mode for a client that does not say: the mode in use, else the first of
/// the locale's.
std::string currentKeyboardInputMode(const platform::InputModes& inputModes);

}  // namespace sable

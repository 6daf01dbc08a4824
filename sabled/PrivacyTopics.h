#pragma once

#include <cstddef>
#include <string_view>

namespace sable {

/// What one step of a request tells of the device, in words for the user. Text is the step's own, or lives
/// for ever.
struct PrivacyTopic {
  std::string_view step;
  std::string_view what;     ///< empty: nothing of the device, but what is asked for
  std::string_view why;      ///< what the service needs it for
  std::string_view control;  ///< what changes it, or turns it off
  std::size_t order = 0;     ///< its place in a list, what tells most first
};

/// The topic of a step; one without an entry tells what its own name says.
PrivacyTopic privacyTopic(std::string_view step);

}  // namespace sable

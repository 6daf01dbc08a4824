#pragma once

#include <string_view>

#include "platform/Subsystem.h"

/// Names and values that the daemon, its clients and the service share. All leave the process.
namespace sable {

inline constexpr std::string_view kSBLErrorDomain = "SBLErrorDomain";
inline constexpr std::string_view kSBLSabledNameVersion = "Sabled/1.0";
inline constexpr std::string_view kSBLSubsystem = platform::kSubsystem;
/// The name under which clients find the daemon.
inline constexpr std::string_view kSBLServiceName = kSBLSubsystem;
/// Counts every search sent to the service, by any client.
inline constexpr std::string_view kSBLSearchCounterKey = "com.kestrel.sabled.searches";

inline constexpr std::string_view kSBLLookupHintsWeekly = "lookup_hints_weekly";
inline constexpr std::string_view kSBLLookupHintsMonthly = "lookup_hints_monthly";
inline constexpr std::string_view kSBLInstalledAppWhitelist = "installed_app_whitelist";

inline constexpr std::string_view kSBLNotifyEnabled = "com.kestrel.sable.enabled";
inline constexpr std::string_view kSBLNotifyDisabled = "com.kestrel.sable.disabled";
/// Key of the bag in the user info of "SBLBagChangeNotification": std::shared_ptr<const SBLBag>.
inline constexpr std::string_view kSBLNotificationBagKey = "bag";

// User settings with registered defaults.
inline constexpr std::string_view kSBLSharedSession = "SBLSharedSession";
inline constexpr std::string_view kSBLSessionSizeLimit = "SBLSessionSizeLimit";
inline constexpr std::string_view kSBLSessionMaxAge = "SBLSessionMaxAge";
inline constexpr std::string_view kSBLUseBramble = "SBLUseBramble";

// Settings that the daemon writes: whether the bag lets the service answer the messages client (its
// search for images by hashtag) and the news client, for these to show or hide what depends on it.
inline constexpr std::string_view kSBLHashtagImagesVisible = "SBLHashtagImagesVisible";
inline constexpr std::string_view kSBLNewsVisible = "SBLNewsVisible";

}  // namespace sable

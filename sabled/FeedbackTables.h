#pragma once

#include <array>
#include <cstdint>
#include <span>
#include <string_view>

/// The words for the numbers in feedback messages, by index. Clients send the numbers, session
/// files keep them and the service reads the words: never renumber, never respell.
namespace sable::feedback {

/// "type" of a record by its type index.
inline constexpr std::string_view kTypes[] = {"visible_results",
                                              "network_search_start",
                                              "network_search_end",
                                              "local_search_start",
                                              "local_search_end",
                                              "search_view_appear",
                                              "search_view_disappear",
                                              "rank_sections",
                                              "result_engagement",
                                              "visible_card",
                                              "card_engagement",
                                              "error",
                                              "suggestion_engagement",
                                              "card_view_disappear",
                                              "search_start",
                                              "search_end",
                                              "visible_suggestions",
                                              "custom_unknown",
                                              "custom_crowdsourcing",
                                              "custom_rover_autofill",
                                              "custom_beacon_result_features",
                                              "unknown",
                                              "results_received_after_timeout",
                                              "late_sections_appended",
                                              "clear_input",
                                              "session_end",
                                              "skip_sable_search",
                                              "section_engagement",
                                              "visible_section_header",
                                              "session_missing_results",
                                              "session_missing_suggestions",
                                              "did_go_to_site",
                                              "connection_invalidated",
                                              "result_grade",
                                              "did_go_to_search"};

inline constexpr std::string_view kSessionEndReasons[] = {
    "no previous session", "external request", "session idle",       "max session time passed",
    "guid changed",        "critical memory",  "engagement received"};

inline constexpr std::string_view kStartSearchTriggers[] = {"unknown",
                                                            "new_character",
                                                            "ime_commit",
                                                            "backspace",
                                                            "voice_search",
                                                            "dictation",
                                                            "copy_and_paste",
                                                            "drag_and_drop",
                                                            "suggestion",
                                                            "prefetch",
                                                            "partial_suggestion",
                                                            "lookup",
                                                            "cross_button",
                                                            "show_more",
                                                            "card",
                                                            "image_load",
                                                            "bag",
                                                            "unlock_device",
                                                            "correction",
                                                            "warm"};

inline constexpr std::string_view kEndpoints[] = {
    "unknown",     "sable",  "google", "yahoo",     "bing",       "duckduckgo", "sable_search",
    "sable_image", "yandex", "baidu",  "sable_bag", "sable_card", "sable_warm"};

inline constexpr std::string_view kLookupSelections[] = {"lookup_default", "lookup_explicit",
                                                         "lookup_hint_tap"};

inline constexpr std::string_view kLocalIndexes[] = {
    "unknown", "beacon", "calculator", "chronicle", "rover_bookmarks", "rover_history", "lookup_dictionary"};

inline constexpr std::string_view kResultTypes[] = {"unknown",
                                                    "sable",
                                                    "local",
                                                    "core_beacon",
                                                    "ua_user_activity",
                                                    "rover_tophit",
                                                    "calculator",
                                                    "conversion",
                                                    "dictionary_definition",
                                                    "google",
                                                    "yahoo",
                                                    "bing",
                                                    "duckduckgo",
                                                    "yandex",
                                                    "baidu"};

inline constexpr std::string_view kTopHits[] = {"tophit_no", "tophit_should_be", "tophit_must_be"};

inline constexpr std::string_view kVisibleResultsTriggers[] = {
    "unknown",   "result_list_updated", "scroll",        "show_more", "peek",
    "pop",       "show_less",           "card_swipe",    "click",     "view_resized",
    "scroll_up", "scroll_down",         "resume_search", "arrow_up",  "arrow_down"};

inline constexpr std::string_view kResultEngagementTriggers[] = {"unknown",
                                                                 "enter",
                                                                 "tap",
                                                                 "click",
                                                                 "double_click",
                                                                 "peek",
                                                                 "pop",
                                                                 "reveal",
                                                                 "arrow_up",
                                                                 "arrow_down",
                                                                 "three_fingers_tap",
                                                                 "swipe",
                                                                 "forced_after_list_update",
                                                                 "shortcut"};

inline constexpr std::string_view kDestinations[] = {"unknown",
                                                     "card",
                                                     "punchout",
                                                     "none",
                                                     "insert",
                                                     "find_on_page",
                                                     "last_search",
                                                     "maps_card",
                                                     "emporium_sheet",
                                                     "hosted_html_page",
                                                     "more_locations_in_maps"};

inline constexpr std::string_view kResultActionTargets[] = {"unknown", "directions", "call", "message",
                                                            "play",    "view",       "open"};

inline constexpr std::string_view kCardTypes[] = {"unknown", "normal", "maps", "emporium_sheet",
                                                  "hosted_html_page"};

inline constexpr std::string_view kStoreProductPageResults[] = {
    "canceled_product_page",      "closed_product_page", "product_page_download_finished",
    "user_hit_goto_store_button", "user_purchased_item", "user_hit_custom_right_bar_button"};

inline constexpr std::string_view kCardViewDisappearTriggers[] = {"unknown", "back", "swipe",
                                                                  "pop",     "done", "replaced"};

inline constexpr std::string_view kSuggestionTypes[] = {"unknown", "sable", "proactive", "recents"};

inline constexpr std::string_view kClearInputTriggers[] = {"unknown", "cross_button", "cut", "backspace"};

inline constexpr std::string_view kSectionEngagementTriggers[] = {"unknown", "search_in_app", "show_more",
                                                                  "show_less"};

inline constexpr std::string_view kSectionHeaderTypes[] = {"unknown", "search_in_app", "show_more", "normal"};

inline constexpr std::string_view kSearchViewAppearTriggers[] = {"unknown",
                                                                 "swipe_down",
                                                                 "today_view",
                                                                 "lock_screen",
                                                                 "breadcrumb",
                                                                 "keyboard_shortcut",
                                                                 "mouse_click_on_menu",
                                                                 "app_launch",
                                                                 "new_tab",
                                                                 "tap_to_input",
                                                                 "new_window",
                                                                 "click",
                                                                 "tab_switch",
                                                                 "orb",
                                                                 "contextual_menu",
                                                                 "lookup_hint_tap",
                                                                 "lookup_tap",
                                                                 "swipe_up",
                                                                 "swipe_left",
                                                                 "swipe_right",
                                                                 "start_composing",
                                                                 "find_popular_items",
                                                                 "pull_down_home_screen",
                                                                 "notification_center",
                                                                 "partial_pull_down",
                                                                 "unlock_device",
                                                                 "did_enter_foreground"};

inline constexpr std::string_view kSearchViewDisappearTriggers[] = {"unknown",
                                                                    "killed",
                                                                    "home_button",
                                                                    "task_switcher",
                                                                    "cancel",
                                                                    "escape",
                                                                    "close_window_by_keyboard",
                                                                    "close_window_by_mouse",
                                                                    "minimize_window_by_keyboard",
                                                                    "minimize_window_by_mouse",
                                                                    "switched_to_other_app",
                                                                    "quit_app",
                                                                    "lock_button",
                                                                    "click_notification_banner",
                                                                    "phone_call",
                                                                    "lost_focus",
                                                                    "done",
                                                                    "swipe_down",
                                                                    "swipe_up",
                                                                    "swipe_left",
                                                                    "swipe_right",
                                                                    "share_button",
                                                                    "device_idle",
                                                                    "did_enter_background",
                                                                    "go_to_site"};

inline constexpr std::string_view kSkipSearchTriggers[] = {
    "unknown",           "less_than_minimum_query_length",    "bag_disabled", "bag_fetch_failed", "cache_hit",
    "empty_query_input", "query_input_with_uri_scheme_prefix"};

inline constexpr std::string_view kResultGrades[] = {"unknown", "disastrous", "bad", "ok",
                                                     "good",    "excellent",  "none"};

/// Card sections are engaged in fewer ways than results.
inline constexpr auto kCardSectionEngagementTriggers = std::span(kResultEngagementTriggers).first<10>();

/// "action_target" of a maps place card by the maps service's own code; the codes between have no
/// word. The table was made by inserting words into 201 empty places, which is why it has 223.
inline constexpr auto kMapsActions = [] {
  std::array<std::string_view, 201 + 22> table{};
  table[0] = "unknown";
  table[2] = "phone_number";
  table[3] = "website";
  table[5] = "add_contact";
  table[6] = "share";
  table[12] = "directions_to_here";
  table[13] = "directions_from_here";
  table[14] = "dismissed";
  table[62] = "report_a_problem";
  table[124] = "edit_contact";
  table[125] = "delete_contact";
  table[127] = "aerial_tour";
  table[172] = "all_photos";
  table[173] = "photo";
  table[174] = "add_photo";
  table[175] = "all_reviews";
  table[176] = "review";
  table[177] = "write_review";
  table[178] = "deal";
  table[179] = "checkin";
  table[180] = "more_info";
  table[201] = "postal_address";
  return table;
}();

/// The index of "unknown": of every kind without a translation.
inline constexpr unsigned kUnknownType = 21;

/// The word of a table; empty for a number that has none.
constexpr std::string_view wordOf(std::span<const std::string_view> table, std::uint64_t index) {
  return index < table.size() ? table[index] : std::string_view();
}

}  // namespace sable::feedback

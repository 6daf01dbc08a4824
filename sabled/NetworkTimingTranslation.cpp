#include "sabled/NetworkTimingTranslation.h"

#include <fmt/core.h>

#include <algorithm>
#include <cmath>
#include <optional>
#include <vector>

#include "platform/IPAddress.h"
#include "sabled/FeedbackTranslation.h"

namespace sable::feedback {

namespace {

using Entry = messages::SBLNetworkTiming::Entry;

constexpr std::string_view kConnectionStartTimeCounts = "ConnectionStartTimeCounts";
constexpr std::string_view kTCPFastOpenStats = "_kWickTimingDataTCPFastOpenStats";
constexpr std::string_view kBramble = "Bramble";
/// The N stands for the start or the stop count.
constexpr std::size_t kStatPrefixLength = std::string_view("_kWickTimingDataNStat").size();

constexpr char kFamilyIPv4 = 2, kFamilyIPv6 = 30;
constexpr std::size_t kIPv4Bytes = 16, kIPv6Bytes = 28;

struct SableNetEventTimingFeedback {
  std::string_view name;
  double value;  // seconds
};

struct SableNetEventStatsFeedback {
  std::string_view name;
  const messages::SBLNetworkTiming& stats;
  void (*write)(JSONPlace place, const messages::SBLNetworkTiming& stats);
};

std::string_view withoutPrefix(std::string_view key) {
  if (key.starts_with(kTimingPrefix)) key.remove_prefix(kTimingPrefix.size());
  return key;
}

/// Whether the key is the prefix and then exactly `name`.
bool isTimingKey(std::string_view key, std::string_view name) {
  return key.starts_with(kTimingPrefix) && withoutPrefix(key) == name;
}

void everyEntry(JSONPlace place, const messages::SBLNetworkTiming& statistics);

void writeValue(JSONPlace place, const Entry& entry) {
  switch (entry.value_case()) {
    case Entry::kNumber:
      return place = entry.number();
    case Entry::kInteger:
      return place = entry.integer();
    case Entry::kFlag:
      return place = entry.flag();
    case Entry::kText:
      return place = entry.text();
    case Entry::kStatistics:
      return everyEntry(place, entry.statistics());
    case Entry::kData:  // JSON has no bytes
    case Entry::VALUE_NOT_SET:
      break;
  }
  place = nullptr;
}

void everyEntry(JSONPlace place, const messages::SBLNetworkTiming& statistics) {
  JSONObject stats(place);
  const auto key = [](const Entry& entry) -> std::optional<std::string_view> { return entry.key(); };
  for (const Entry* entry : withoutRepeated(statistics.entries(), key))
    writeValue(stats[entry->key()], *entry);
}

std::string_view statName(const Entry& entry) {
  return std::string_view(entry.key()).substr(std::min(kStatPrefixLength, entry.key().size()));
}

/// Those whose integer part is not 0.
void countsOf(JSONPlace place, const messages::SBLNetworkTiming& statistics) {
  JSONObject stats(place);
  const auto countName = [](const Entry& entry) {
    const bool counts = entry.has_number() ? std::abs(entry.number()) >= 1 : entry.integer() != 0;
    return counts ? std::optional(statName(entry)) : std::nullopt;
  };
  for (const Entry* entry : withoutRepeated(statistics.entries(), countName))
    writeValue(stats[statName(*entry)], *entry);
}

std::int64_t roundedMilliseconds(double seconds) {
  constexpr double kLimit = 9e18;  // a hostile clock must not leave the integers
  return std::llround(std::clamp(seconds * 1000, -kLimit, kLimit));
}

/// The last entry of that name, as of a dictionary's members.
const Entry* find(const messages::SBLNetworkTiming& timing, std::string_view name) {
  const Entry* found = nullptr;
  for (const Entry& entry : timing.entries()) {
    if (isTimingKey(entry.key(), name)) found = &entry;
  }
  return found;
}

std::uint16_t portOf(std::string_view data) {
  return static_cast<std::uint16_t>(static_cast<unsigned char>(data[2]) << 8 |
                                    static_cast<unsigned char>(data[3]));
}

/// Empty when it is no address.
std::string peerAddress(std::string_view data) {
  if (data.size() < kIPv4Bytes) return {};
  if (data[1] == kFamilyIPv4) {
    return fmt::format("{}:{}", platform::numericAddress(data.substr(4, 4)), portOf(data));
  }
  if (data[1] == kFamilyIPv6 && data.size() >= 24) {
    return fmt::format("[{}]:{}", platform::numericAddress(data.substr(8, 16)), portOf(data));
  }
  return {};
}

}  // namespace

void writeNetworkTiming(const messages::SBLNetworkTiming& timing, JSONObject& object) {
  formatNetworkTimingData(object["network_timing_data"], timing);
  const Entry* reused = find(timing, kConnectionReused);
  if (reused != nullptr && reused->has_flag()) {
    object["connection_reused"] = reused->flag();
  } else {
    object["connection_reused"] = nullptr;
  }
  const Entry* interface = find(timing, kConnectionInterface);
  if (interface != nullptr && !interface->text().empty()) object["interface"] = interface->text();
  const Entry* peer = find(timing, kConnectionPeerAddress);
  const std::string address = peer == nullptr ? std::string() : peerAddress(peer->data());
  if (!address.empty()) object["peer_address"] = address;
}

void formatNetworkTimingData(JSONPlace place, const messages::SBLNetworkTiming& timing) {
  std::vector<SableNetEventTimingFeedback> moments;
  std::vector<SableNetEventStatsFeedback> statistics;
  for (const Entry& entry : timing.entries()) {
    const std::string_view key = entry.key();
    const std::string_view name = withoutPrefix(key);
    if (isTimingKey(key, kConnectionStartTimeCounts) || isTimingKey(key, kConnectionStopTimeCounts)) {
      if (entry.has_statistics()) statistics.push_back({name, entry.statistics(), countsOf});
    } else if (key.find(kTCPFastOpenStats) != key.npos) {
      if (entry.has_statistics()) statistics.push_back({name, entry.statistics(), everyEntry});
    } else if (key.find("Start") != key.npos || key.find("End") != key.npos) {
      const double moment = entry.has_number() ? entry.number() : static_cast<double>(entry.integer());
      if (std::isfinite(moment) && moment != 0) moments.push_back({name, moment});
    } else if (key == kBramble && entry.has_statistics()) {
      statistics.push_back({kBramble, entry.statistics(), everyEntry});
    }
  }
  std::stable_sort(moments.begin(), moments.end(),
                   [](const auto& one, const auto& other) { return one.value < other.value; });

  if (moments.empty() && statistics.empty()) return place = nullptr;
  JSONArray data(place);
  for (const auto& [name, moment] : moments) {
    JSONArray pair(data.next());
    pair.next() = name;
    pair.next() = roundedMilliseconds(moment - moments.front().value);
  }
  for (const auto& [name, stats, write] : statistics) {
    JSONArray pair(data.next());
    pair.next() = name;
    write(pair.next(), stats);
  }
}

std::string peerAddressData(const std::string& numericAddress, std::uint16_t port) {
  const auto address = platform::addressBytes(numericAddress);
  if (!address) return {};
  const bool six = address->size() != 4;
  std::string data(six ? kIPv6Bytes : kIPv4Bytes, '\0');
  data[0] = static_cast<char>(data.size());
  data[1] = six ? kFamilyIPv6 : kFamilyIPv4;
  data[2] = static_cast<char>(port >> 8);
  data[3] = static_cast<char>(port & 0xff);
  data.replace(six ? 8 : 4, address->size(), *address);
  return data;
}

}  // namespace sable::feedback

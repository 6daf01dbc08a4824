#include "sabled/NetworkTimingTranslation.h"

#include <fmt/core.h>

#include <algorithm>
#include <cmath>
#include <nlohmann/json.hpp>
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
  Dictionary stats;
};

std::string_view withoutPrefix(std::string_view key) {
  if (key.starts_with(kTimingPrefix)) key.remove_prefix(kTimingPrefix.size());
  return key;
}

/// Whether the key is the prefix and then exactly `name`.
bool isTimingKey(std::string_view key, std::string_view name) {
  return key.starts_with(kTimingPrefix) && withoutPrefix(key) == name;
}

Dictionary everyEntry(const messages::SBLNetworkTiming& statistics);

Dictionary value(const Entry& entry) {
  switch (entry.value_case()) {
    case Entry::kNumber:
      return entry.number();
    case Entry::kInteger:
      return entry.integer();
    case Entry::kFlag:
      return entry.flag();
    case Entry::kText:
      return entry.text();
    case Entry::kStatistics:
      return everyEntry(entry.statistics());
    case Entry::kData:  // JSON has no bytes
    case Entry::VALUE_NOT_SET:
      break;
  }
  return nullptr;
}

Dictionary everyEntry(const messages::SBLNetworkTiming& statistics) {
  ObjectBuilder stats;
  for (const Entry& entry : statistics.entries()) stats.set(entry.key(), value(entry));
  return stats.take();
}

/// Those whose integer part is not 0.
Dictionary countsOf(const messages::SBLNetworkTiming& statistics) {
  ObjectBuilder stats;
  for (const Entry& entry : statistics.entries()) {
    const bool counts = entry.has_number() ? std::abs(entry.number()) >= 1 : entry.integer() != 0;
    const std::string_view key = entry.key();
    if (counts) stats.set(std::string(key.substr(std::min(kStatPrefixLength, key.size()))), value(entry));
  }
  return stats.take();
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

void writeNetworkTiming(const messages::SBLNetworkTiming& timing, Dictionary& dictionary) {
  dictionary["network_timing_data"] = formatNetworkTimingData(timing);
  const Entry* reused = find(timing, kConnectionReused);
  dictionary["connection_reused"] =
      reused != nullptr && reused->has_flag() ? Dictionary(reused->flag()) : Dictionary();
  const Entry* interface = find(timing, kConnectionInterface);
  if (interface != nullptr && !interface->text().empty()) dictionary["interface"] = interface->text();
  const Entry* peer = find(timing, kConnectionPeerAddress);
  const std::string address = peer == nullptr ? std::string() : peerAddress(peer->data());
  if (!address.empty()) dictionary["peer_address"] = address;
}

Dictionary formatNetworkTimingData(const messages::SBLNetworkTiming& timing) {
  std::vector<SableNetEventTimingFeedback> moments;
  std::vector<SableNetEventStatsFeedback> statistics;
  for (const Entry& entry : timing.entries()) {
    const std::string_view key = entry.key();
    const std::string_view name = withoutPrefix(key);
    if (isTimingKey(key, kConnectionStartTimeCounts) || isTimingKey(key, kConnectionStopTimeCounts)) {
      if (entry.has_statistics()) statistics.push_back({name, countsOf(entry.statistics())});
    } else if (key.find(kTCPFastOpenStats) != key.npos) {
      if (entry.has_statistics()) statistics.push_back({name, everyEntry(entry.statistics())});
    } else if (key.find("Start") != key.npos || key.find("End") != key.npos) {
      const double moment = entry.has_number() ? entry.number() : static_cast<double>(entry.integer());
      if (std::isfinite(moment) && moment != 0) moments.push_back({name, moment});
    } else if (key == kBramble && entry.has_statistics()) {
      statistics.push_back({kBramble, everyEntry(entry.statistics())});
    }
  }
  std::stable_sort(moments.begin(), moments.end(),
                   [](const auto& one, const auto& other) { return one.value < other.value; });

  Dictionary data;
  for (const auto& [name, moment] : moments) {
    data.push_back(Dictionary::array({name, roundedMilliseconds(moment - moments.front().value)}));
  }
  for (auto& [name, stats] : statistics) data.push_back(Dictionary::array({name, std::move(stats)}));
  return data;
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

#pragma once

#include "SableKit/messages/Shared.pb.h"
#include "sabled/JSONWriter.h"

/// The network's part of an end-network-search feedback. The names come from the clients' network
/// library, which the service knows them by.
namespace sable::feedback {

/// "_kWickTimingData": of a name on the wire this is left out.
inline constexpr std::string_view kTimingPrefix = "_kWickTimingData";

// Entries, without that prefix, that have a key of their own.
inline constexpr std::string_view kConnectionReused = "ConnectionReused";
inline constexpr std::string_view kConnectionInterface = "ConnectionInterfaceIdentifier";
inline constexpr std::string_view kConnectionPeerAddress = "ConnectionPeerAddress";
inline constexpr std::string_view kConnectionStopTimeCounts = "ConnectionStopTimeCounts";

/// Adds "network_timing_data", "connection_reused", "interface" and "peer_address"; the first two
/// are null where the timing does not tell, the others are left out.
void writeNetworkTiming(const messages::SBLNetworkTiming& timing, JSONObject& object);

/// Writes the moments as [name, milliseconds since the earliest], then the statistics as [name, object];
/// null when there are none.
void formatNetworkTimingData(JSONPlace place, const messages::SBLNetworkTiming& timing);

/// The bytes of a peer address in an entry, laid out as on every client:
///
///     0   1   length
///     1   1   family: 2 is IPv4, 30 is IPv6
///     2   2   port, network order
///     4   4   IPv4 address, then 8 zero bytes; or flow label of IPv6
///     8  16   IPv6 address, then 4 bytes scope
std::string peerAddressData(const std::string& numericAddress, std::uint16_t port);

}  // namespace sable::feedback

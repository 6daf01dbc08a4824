#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "SableKit/SBLImageDescription.h"
#include "SableKit/SBLReply.h"
#include "SableKit/SBLRequest.h"
#include "SableKit/SBLSessionConfiguration.h"
#include "platform/Error.h"
#include "platform/RelayValue.h"

/// Records as they travel over Relay: `a{sv}`, absent members left out, an empty record for "none".
namespace sable {

platform::RelayRecord encodeConfiguration(const SBLSessionConfiguration& configuration);
SBLSessionConfiguration decodeConfiguration(const platform::RelayRecord& record);

std::string_view requestClassName(const SBLAnyRequest& request);
platform::RelayRecord encodeRequest(const SBLAnyRequest& request);
/// The request of a class; nullopt for a class that is no request's.
std::optional<SBLAnyRequest> decodeRequest(std::string_view className, const platform::RelayRecord& record);

platform::RelayRecords encodeImageDescriptions(const std::vector<SBLImageDescription>& descriptions);
/// One for each record; a member of another type than string is absent.
std::vector<SBLImageDescription> decodeImageDescriptions(const platform::RelayRecords& records);

platform::RelayRecord encodeError(const std::optional<Error>& error);
std::optional<Error> decodeError(const platform::RelayRecord& record);

platform::RelayRecord encodeReply(const std::optional<SBLReply>& reply);
std::optional<SBLReply> decodeReply(const platform::RelayRecord& record);

}  // namespace sable

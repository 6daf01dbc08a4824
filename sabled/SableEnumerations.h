#pragma once

#include <string>
#include <string_view>

/// Small enumerations and their words on the wire. The values are stored in feedback: never
/// renumber. Parsers and printers differ on purpose, odd spellings included: peers depend on them.
namespace sable {

enum class FeatureType { domain = 0, mediaType = 1, topic = 2, unknown = 3 };
/// "domain" and "tld", "mediatype" in any letter case and "mt", "topic".
int featureTypeFromString(std::string_view text);
std::string_view stringFromFeatureType(int type);

enum class ClientType { rover = 0, beacon = 1, unknown = 2 };
int clientTypeFromString(std::string_view text);
std::string_view stringFromClientType(int type);

enum class FunctionType { eng = 0, engRender = 1, unknown = 2 };
/// "engrate" and "eng/render" are the same function; it prints as the latter.
int funcTypeFromString(std::string_view text);
std::string_view stringFromFunctionType(int type);

enum class ResultPlacement { unknown = 0, top = 1, bottom = 2 };
int resultPlacementFromString(std::string_view text);
std::string_view stringFromResultPlacement(int placement);

/// Name of a flusher: 0 "crowdsourcing", 1 "Feedbacks", else "".
std::string_view convertIdentifierToString(int flusherIdentifier);

}  // namespace sable

#include "sabled/SableEnumerations.h"

#include "sabled/ClientNames.h"

namespace sable {

int featureTypeFromString(std::string_view text) {
  if (text == "domain" || text == "tld") return static_cast<int>(FeatureType::domain);
  if (lowercasedASCII(text) == "mediatype" || text == "mt") return static_cast<int>(FeatureType::mediaType);
  if (text == "topic") return static_cast<int>(FeatureType::topic);
  return static_cast<int>(FeatureType::unknown);
}

std::string_view stringFromFeatureType(int type) {
  switch (static_cast<FeatureType>(type)) {
    case FeatureType::domain:
      return "domain";
    case FeatureType::mediaType:
      return "mediaType";
    case FeatureType::topic:
      return "topic";
    default:
      return "unkonwn";  // spelled so on the wire: the service knows this word
  }
}

int clientTypeFromString(std::string_view text) {
  if (text == "rover") return static_cast<int>(ClientType::rover);
  if (text == "beacon") return static_cast<int>(ClientType::beacon);
  return static_cast<int>(ClientType::unknown);
}

std::string_view stringFromClientType(int type) {
  switch (static_cast<ClientType>(type)) {
    case ClientType::rover:
      return "rover";
    case ClientType::beacon:
      return "beacon";
    default:
      return "unknown";
  }
}

int funcTypeFromString(std::string_view text) {
  if (text == "eng") return static_cast<int>(FunctionType::eng);
  if (text == "engrate" || text == "eng/render") return static_cast<int>(FunctionType::engRender);
  return static_cast<int>(FunctionType::unknown);
}

std::string_view stringFromFunctionType(int type) {
  switch (static_cast<FunctionType>(type)) {
    case FunctionType::eng:
      return "eng";
    case FunctionType::engRender:
      return "eng/render";
    default:
      return "unknown";
  }
}

int resultPlacementFromString(std::string_view text) {
  if (text == "top") return static_cast<int>(ResultPlacement::top);
  if (text == "bottom") return static_cast<int>(ResultPlacement::bottom);
  return static_cast<int>(ResultPlacement::unknown);
}

std::string_view stringFromResultPlacement(int placement) {
  switch (static_cast<ResultPlacement>(placement)) {
    case ResultPlacement::top:
      return "top";
    case ResultPlacement::bottom:
      return "bottom";
    default:
      return "unkonw";  // not the spelling of the unknown feature type; both are on the wire
  }
}

std::string_view convertIdentifierToString(int flusherIdentifier) {
  switch (flusherIdentifier) {
    case 0:
      return "crowdsourcing";
    case 1:
      return "Feedbacks";
    default:
      return "";
  }
}

}  // namespace sable

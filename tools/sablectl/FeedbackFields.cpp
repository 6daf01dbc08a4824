#include "tools/sablectl/FeedbackFields.h"

#include <fstream>
#include <nlohmann/json.hpp>
#include <sstream>

#include "SableKit/messages/MessageJSON.h"
#include "platform/Dictionary.h"
#include "tools/sablectl/RequestRecord.h"

namespace sable::sablectl {

Expected<std::string> feedbackFromFields(const std::string& className,
                                         const std::vector<std::string>& words) {
  Dictionary fields = Dictionary::object();
  for (const std::string& word : words) {
    auto pair = nameAndValue(word);
    if (!pair) return tl::unexpected(pair.error());
    auto& [name, value] = *pair;
    if (value.starts_with('[') || value.starts_with('{')) {
      auto parsed = parseJSON(value, value.size());
      if (!parsed)
        return tl::unexpected(
            Error{parsed.error().domain, parsed.error().code, name + ": " + parsed.error().reason});
      fields[name] = std::move(*parsed);
    } else {
      fields[name] = std::move(value);
    }
  }
  return messageFromJSON(className, compactJSON(fields));
}

Expected<std::string> feedbackFromFile(const std::string& className, const std::filesystem::path& file) {
  std::ifstream stream(file, std::ios::binary);
  std::ostringstream text;
  if (!stream || !(text << stream.rdbuf())) return tl::unexpected(posixError(errno, file.string()));
  return messageFromJSON(className, text.str());
}

}  // namespace sable::sablectl

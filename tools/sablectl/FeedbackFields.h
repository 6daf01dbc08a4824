#pragma once

#include <filesystem>
#include <string>
#include <vector>

#include "platform/Error.h"

namespace sable::sablectl {

/// The bytes of a message of "NAME=VALUE" words. A value that begins with "[" or "{" is JSON, any
/// other is a text, as which protobuf's JSON form takes numbers and flags too.
Expected<std::string> feedbackFromFields(const std::string& className, const std::vector<std::string>& words);

/// The bytes of a message in protobuf's JSON form.
Expected<std::string> feedbackFromFile(const std::string& className, const std::filesystem::path& file);

}  // namespace sable::sablectl

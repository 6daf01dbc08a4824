#pragma once

#include <string>
#include <string_view>

#include "platform/Error.h"

namespace sable::sablectl {

/// The text in a raw DEFLATE stream (RFC 1951), of at most 64 MiB.
Expected<std::string> inflateUpload(std::string_view body);

}  // namespace sable::sablectl

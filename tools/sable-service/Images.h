#pragma once

#include "Message.h"

namespace service {

/// GET /images/NAME: a PNG of 64 by 64 pixels whose colours follow from its name, so that every name has an
/// image of its own and always the same one. NAME is made of letters, digits and ". _ + -"; anything else is
/// 404. With ?bytes=N zeros behind its end, which no decoder minds, make it N bytes long, up to 256 MiB.
/// GET /images/redirect?to=URL: 302 with this Location.
Answer imageAnswer(const Request& request);

/// The PNG itself (ISO/IEC 15948).
std::string drawImage(const std::string& name);

}  // namespace service

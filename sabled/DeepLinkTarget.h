#pragma once

#include <optional>
#include <string>

#include "platform/DeepLinkSpool.h"

namespace sable {

/// What may be told, randomised, of a deep link: which application has public content where, never
/// which content. "org.example.Reader www.example.org" for a universal link (http or https),
/// "org.example.Reader reader:" for one of the application's own scheme: path, query and fragment stay.
///
/// nullopt for a link that is not fit to be told at all:
///   - one with user information or a port,
///   - a universal link to a host that is no public name: an address, a single word, a name reserved for
///     local or special use (RFC 6761, 6762, 7686, 8375, 9476), one that is not plain ASCII;
///   - a scheme that is no application's own ("mailto:" tells of a person);
///   - what is no link, or no bundle identifier, of reasonable length.
std::optional<std::string> deepLinkTarget(const platform::DeepLink& link);

}  // namespace sable

#pragma once

#include <string>
#include <string_view>

namespace sable::platform {

/// UTF-8 text in lower case: the full mapping of the Unicode Standard (section 3.13, toLowercase),
/// the same for every language. It may change the length ("İ" becomes two characters) and looks at
/// neighbours (a sigma that ends a word). Bytes that are no UTF-8 stay. Any thread.
std::string lowercased(std::string_view text);

}  // namespace sable::platform

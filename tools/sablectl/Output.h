#pragma once

#include <cstddef>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Dictionary.h"
#include "platform/Error.h"

namespace sable::sablectl {

enum class Colour { none, bold, dim, red, green, cyan };

/// Where a command's results go: standard output, for a person or as JSON.
struct Output {
  bool json = false;
  bool colours = false;     ///< standard output is a terminal, and NO_COLOR is not set
  std::size_t width = 100;  ///< columns

  /// What this process's standard output is.
  static Output standard(bool json);

  /// The text in a colour, where colours are wanted.
  std::string paint(Colour colour, std::string_view text) const;
  /// Writes one line and lets it be seen.
  void line(std::string_view text) const;
  /// Writes a JSON document: on one line in a stream of them, else indented.
  void document(const Dictionary& value) const;
  void streamDocument(const Dictionary& value) const;
};

/// One line on standard error: "sablectl: ...".
void complain(std::string_view text);

/// Rows in columns of equal width, two blanks between them; the last column is not padded.
std::vector<std::string> aligned(const std::vector<std::vector<std::string>>& rows);

/// A value on one line: strings as they are, the rest as compact JSON; nothing in it is harmful.
std::string plainText(const Dictionary& value);

/// JSON text that is safe on a terminal.
std::string indentedJSON(const Dictionary& value);

}  // namespace sable::sablectl

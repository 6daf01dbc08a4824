#include "tools/sablectl/Output.h"

#include <sys/ioctl.h>
#include <unistd.h>

#include <algorithm>
#include <charconv>
#include <cstdio>
#include <cstdlib>
#include <nlohmann/json.hpp>

#include "tools/sablectl/Text.h"

namespace sable::sablectl {
namespace {

std::string_view environment(const char* name) {
  const char* value = std::getenv(name);
  return value == nullptr ? std::string_view() : value;
}

std::size_t columnsOf(int descriptor) {
  winsize size{};
  if (ioctl(descriptor, TIOCGWINSZ, &size) == 0 && size.ws_col > 0) return size.ws_col;
  std::size_t columns = 0;
  const std::string_view text = environment("COLUMNS");
  std::from_chars(text.data(), text.data() + text.size(), columns);
  return columns > 0 ? columns : Output().width;
}

std::string_view codeOf(Colour colour) {
  switch (colour) {
    case Colour::bold:
      return "1";
    case Colour::dim:
      return "2";
    case Colour::red:
      return "31";
    case Colour::green:
      return "32";
    case Colour::cyan:
      return "36";
    case Colour::none:
      break;
  }
  return "";
}

void write(std::FILE* file, std::string text) {
  text += '\n';
  std::fwrite(text.data(), 1, text.size(), file);
  std::fflush(file);
}

}  // namespace

Output Output::standard(bool json) {
  Output output;
  output.json = json;
  // https://no-color.org: any text in NO_COLOR asks for none.
  output.colours =
      isatty(STDOUT_FILENO) == 1 && environment("NO_COLOR").empty() && environment("TERM") != "dumb";
  output.width = columnsOf(STDOUT_FILENO);
  return output;
}

std::string Output::paint(Colour colour, std::string_view text) const {
  if (!colours || colour == Colour::none) return std::string(text);
  return std::string("\x1b[").append(codeOf(colour)).append("m").append(text).append("\x1b[0m");
}

void Output::line(std::string_view text) const {
  write(stdout, std::string(text));
}

void Output::document(const Dictionary& value) const {
  write(stdout, indentedJSON(value));
}

void Output::streamDocument(const Dictionary& value) const {
  write(stdout, printable(compactJSON(value)));
}

void complain(std::string_view text) {
  write(stderr, "sablectl: " + printable(text));
}

std::vector<std::string> aligned(const std::vector<std::vector<std::string>>& rows) {
  std::vector<std::size_t> widths;
  for (const auto& row : rows) {
    if (widths.size() < row.size()) widths.resize(row.size());
    for (std::size_t i = 0; i < row.size(); ++i) widths[i] = std::max(widths[i], displayWidth(row[i]));
  }
  std::vector<std::string> lines;
  for (const auto& row : rows) {
    std::string& line = lines.emplace_back();
    for (std::size_t i = 0; i < row.size(); ++i)
      line += i + 1 == row.size() ? row[i] : padded(row[i], widths[i] + 2);
    line.erase(line.find_last_not_of(' ') + 1);
  }
  return lines;
}

std::string plainText(const Dictionary& value) {
  return printable(value.is_string() ? value.get_ref<const std::string&>() : compactJSON(value));
}

std::string indentedJSON(const Dictionary& value) {
  return printable(value.dump(2, ' ', false, Dictionary::error_handler_t::replace), Newlines::keep);
}

}  // namespace sable::sablectl

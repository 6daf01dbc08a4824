#include "tools/sablectl/Section.h"

#include <nlohmann/json.hpp>

#include "tools/sablectl/Text.h"

namespace sable::sablectl {

Section::Section(const Output& output, std::vector<std::string>& lines, std::string_view heading)
    : output_(output), lines_(lines) {
  if (!lines.empty()) lines.emplace_back();
  lines.push_back(output.paint(Colour::bold, heading));
}

Section::~Section() {
  for (const std::string& line : aligned(rows_)) lines_.push_back("  " + cut(line, output_.width - 2));
}

Dictionary member(const Dictionary& object, const char* key) {
  const auto found = object.find(key);
  return found == object.end() ? Dictionary() : *found;
}

std::string textOf(const Dictionary& object, const char* key) {
  return plainText(member(object, key));
}

}  // namespace sable::sablectl

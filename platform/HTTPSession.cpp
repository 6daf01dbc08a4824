#include "platform/HTTPSession.h"

#include <algorithm>

namespace sable::platform {
namespace {

char lower(char c) {
  return c >= 'A' && c <= 'Z' ? static_cast<char>(c + ('a' - 'A')) : c;
}

bool sameName(std::string_view a, std::string_view b) {
  return std::equal(a.begin(), a.end(), b.begin(), b.end(),
                    [](char x, char y) { return lower(x) == lower(y); });
}

auto isNamed(std::string_view name) {
  return [name](const auto& field) { return sameName(field.first, name); };
}

}  // namespace

const std::string* HTTPHeaders::find(std::string_view name) const {
  const auto found = std::find_if(fields_.begin(), fields_.end(), isNamed(name));
  return found == fields_.end() ? nullptr : &found->second;
}

void HTTPHeaders::set(std::string_view name, std::string value) {
  const auto first = std::find_if(fields_.begin(), fields_.end(), isNamed(name));
  if (first == fields_.end()) return add(std::string(name), std::move(value));
  first->second = std::move(value);
  fields_.erase(std::remove_if(first + 1, fields_.end(), isNamed(name)), fields_.end());
}

void HTTPHeaders::remove(std::string_view name) {
  std::erase_if(fields_, isNamed(name));
}

}  // namespace sable::platform

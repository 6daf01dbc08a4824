#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "tools/sablectl/Output.h"

namespace sable::sablectl {

/// A heading, and below it rows in columns that stay within the width; written into `lines` with the
/// object's end, a blank line before it.
class Section {
 public:
  Section(const Output& output, std::vector<std::string>& lines, std::string_view heading);
  ~Section();
  Section(const Section&) = delete;
  Section& operator=(const Section&) = delete;

  void row(std::vector<std::string> cells) { rows_.push_back(std::move(cells)); }

 private:
  const Output& output_;
  std::vector<std::string>& lines_;
  std::vector<std::vector<std::string>> rows_;
};

/// The member of an object; null for what is not there.
Dictionary member(const Dictionary& object, const char* key);
/// The member on one line; nothing in it is harmful.
std::string textOf(const Dictionary& object, const char* key);

}  // namespace sable::sablectl

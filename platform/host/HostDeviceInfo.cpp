#include "platform/host/HostDeviceInfo.h"

#include <map>

#include "platform/host/TrustedPath.h"

namespace sable::platform::host {

namespace {

constexpr std::size_t kMaximumBytes = 64u << 10;

std::string readText(const std::filesystem::path& path) {
  const auto file = openTrustedFile(path, LastLink::follow);
  if (!file) return {};
  return readWhole(*file, path, kMaximumBytes).value_or("");
}

/// The model's name on one line; the device tree ends it with a NUL, DMI with a line feed.
std::string productType(const std::filesystem::path& root) {
  for (const char* source : {"sys/class/dmi/id/product_name", "proc/device-tree/model"}) {
    std::string name = readText(root / source);
    name.resize(std::min(name.find_first_of(std::string_view("\n\0", 2)), name.size()));
    name.resize(name.find_last_not_of(" \t") + 1);
    if (!name.empty()) return name;
  }
  return "Linux";
}

/// The value of a shell assignment: quotes taken off, escapes resolved.
std::string unquoted(std::string_view text) {
  std::string value;
  const bool quoted = !text.empty() && (text.front() == '"' || text.front() == '\'');
  const char quote = quoted ? text.front() : '\0';
  if (quoted) text.remove_prefix(1);
  for (std::size_t i = 0; i < text.size() && text[i] != quote; ++i) {
    if (text[i] == '\\' && quote != '\'' && i + 1 < text.size()) ++i;
    value += text[i];
  }
  return value;
}

std::string osRelease(const std::filesystem::path& root, std::initializer_list<std::string_view> names) {
  std::string text = readText(root / "etc/os-release");
  if (text.empty()) text = readText(root / "usr/lib/os-release");
  std::map<std::string_view, std::string> values;
  std::string_view rest = text;
  while (!rest.empty()) {
    const auto end = std::min(rest.find('\n'), rest.size());
    const std::string_view line = rest.substr(0, end);
    rest.remove_prefix(std::min(end + 1, rest.size()));
    const auto sign = line.find('=');
    if (sign != line.npos) values.insert_or_assign(line.substr(0, sign), unquoted(line.substr(sign + 1)));
  }
  for (const std::string_view name : names) {
    if (const auto found = values.find(name); found != values.end() && !found->second.empty())
      return found->second;
  }
  return {};
}

}  // namespace

HostDeviceInfo::HostDeviceInfo(const HostFacts& facts)
    : facts_(facts),
      productType_(productType(facts.sources().root)),
      productName_(osRelease(facts.sources().root, {"NAME"})),
      buildVersion_(osRelease(facts.sources().root, {"VERSION_ID", "BUILD_ID"})) {}

std::string HostDeviceInfo::answer(std::string_view question) const {
  if (question == "ProductType") return facts_.string("product_type").value_or(productType_);
  if (question == "ProductName") return facts_.string("product_name").value_or(productName_);
  if (question == "BuildVersion") return facts_.string("build_version").value_or(buildVersion_);
  return {};
}

double HostDeviceInfo::mainScreenScale() const {
  const double scale = facts_.number("screen_scale").value_or(1);
  return scale > 0 ? scale : 1;
}

}  // namespace sable::platform::host

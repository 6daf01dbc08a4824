#include "tools/sablectl/PrivacyOutput.h"

#include <fmt/format.h>

#include <algorithm>
#include <array>
#include <nlohmann/json.hpp>

#include "tools/sablectl/Section.h"
#include "tools/sablectl/Text.h"

namespace sable::sablectl {
namespace {

using Names = std::vector<std::string>;

/// The requests that users cause; together they are called queries.
constexpr std::array<std::string_view, 5> kQueries{"search", "zero keyword", "more results", "lookup",
                                                   "card"};

std::string listText(Names names) {
  const auto has = [&](std::string_view name) { return std::ranges::count(names, name) > 0; };
  if (std::ranges::all_of(kQueries, has)) {
    std::erase_if(names, [](const std::string& name) { return std::ranges::count(kQueries, name) > 0; });
    names.insert(names.begin(), "queries");
  }
  return fmt::format("{}", fmt::join(names, ", "));
}

Names namesOf(const Dictionary& list) {
  Names names;
  for (const Dictionary& name : list) names.push_back(plainText(name));
  return names;
}

void addRequests(const Output& output, std::vector<std::string>& lines, const Dictionary& requests) {
  Names direct, proxied;
  Section section(output, lines, "Requests");
  for (const Dictionary& request : requests) {
    if (member(request, "sent") != true) continue;
    (member(request, "through_proxy") == true ? proxied : direct).push_back(textOf(request, "request"));
  }
  if (!proxied.empty()) section.row({"through the proxy", listText(proxied)});
  if (!direct.empty()) section.row({"directly", listText(direct)});
  for (const Dictionary& request : requests) {
    if (member(request, "sent") == true) continue;
    section.row({"not sent", textOf(request, "request") + ": " + textOf(request, "why")});
  }
}

std::string reasonText(const Dictionary& value) {
  return fmt::format("{} with {}: {}; {}", textOf(value, "name"),
                     listText(namesOf(member(value, "requests"))), textOf(value, "why"),
                     textOf(value, "control"));
}

/// Each value in a row, and dimmed below it who gets it, what for, and what changes it.
void addValues(const Output& output, std::vector<std::string>& lines, const Dictionary& values) {
  lines.insert(lines.end(), {"", output.paint(Colour::bold, "Told about this device")});
  std::vector<std::vector<std::string>> rows;
  for (const Dictionary& value : values) {
    rows.push_back({textOf(value, "what"), textOf(value, "value")});
  }
  const auto shown = aligned(rows);
  for (std::size_t i = 0; i < shown.size(); ++i) {
    lines.push_back("  " + cut(shown[i], output.width - 2));
    for (const std::string& line : wrapped(reasonText(values[i]), output.width - 6)) {
      lines.push_back(output.paint(Colour::dim, "      " + line));
    }
  }
}

void addUnsent(const Output& output, std::vector<std::string>& lines, const Dictionary& unsent) {
  if (unsent.empty()) return;
  Section section(output, lines, "Not told: not known here, or off");
  for (const Dictionary& topic : unsent) section.row({textOf(topic, "what"), textOf(topic, "control")});
}

std::string identifierLine(const Dictionary& guid) {
  const auto seconds = [&](const char* key) {
    return durationText(static_cast<std::int64_t>(numberMember(guid, key).value_or(0)));
  };
  return fmt::format("The random identifier is {} old and is renewed in {}.", seconds("age"),
                     seconds("rotates_in"));
}

/// What the signature says, for those who cannot read it.
std::string signatureLine(const Names& applications) {
  return fmt::format("The signature of installed applications tells of {}.", fmt::join(applications, ", "));
}

std::string deepLinkLine(const Dictionary& report) {
  return member(report, "diagnostics_allowed") == true
             ? "Diagnostics are allowed: of deep links that applications drop, a few a day are reported, "
               "randomised."
             : "Diagnostics are not allowed: deep links that applications drop are deleted unread.";
}

}  // namespace

std::vector<std::string> privacyLines(const Output& output, const Dictionary& report) {
  std::vector<std::string> lines{"As " + textOf(report, "agent")};
  addRequests(output, lines, member(report, "requests"));
  addValues(output, lines, member(report, "values"));
  addUnsent(output, lines, member(report, "not_sent"));
  lines.insert(lines.end(), {"", identifierLine(member(report, "user_guid")), deepLinkLine(report)});
  if (const Names applications = namesOf(member(report, "signed_applications")); !applications.empty()) {
    lines.push_back(signatureLine(applications));
  }
  lines.push_back(
      "Queries also carry what was typed and what their client adds to them. Images and warm-ups carry none "
      "of this.");
  return lines;
}

}  // namespace sable::sablectl

#include "tools/sablectl/StreamRows.h"

#include <fmt/format.h>

#include <array>
#include <chrono>
#include <ctime>
#include <nlohmann/json.hpp>

#include "platform/UUID.h"
#include "tools/sablectl/Text.h"

namespace sable::sablectl {
namespace {

constexpr std::size_t kTimeWidth = 12, kKindWidth = 23, kQueryWidth = 6, kCountWidth = 7, kGUIDWidth = 8,
                      kReasonWidth = 23;
/// What is left to the last column however narrow the output is.
constexpr std::size_t kLeast = 10;
constexpr std::size_t kLongestValue = 40;

std::string clockTime(platform::WallTime time) {
  const auto milliseconds = std::chrono::floor<std::chrono::milliseconds>(time.time_since_epoch()).count();
  const std::time_t seconds = milliseconds / 1000;
  std::tm local{};
  localtime_r(&seconds, &local);
  return fmt::format("{:02}:{:02}:{:02}.{:03}", local.tm_hour, local.tm_min, local.tm_sec,
                     milliseconds % 1000);
}

/// A column before the last one; a text that is too wide for it is shown whole.
struct Cell {
  std::string text;
  std::size_t width;
  Colour colour = Colour::none;
  bool right = false;
};

std::string row(const Output& output, const std::vector<Cell>& cells, std::string_view last,
                Colour lastColour = Colour::none) {
  std::string line;
  std::size_t taken = 0;
  for (const auto& [text, width, colour, right] : cells) {
    const std::size_t own = displayWidth(text);
    const std::string blanks(width > own ? width - own : 0, ' ');
    const std::string painted = output.paint(colour, text);
    line += (right ? blanks + painted : painted + blanks) + "  ";
    taken += own + blanks.size() + 2;
  }
  const std::size_t left = output.width > taken + kLeast ? output.width - taken : kLeast;
  const std::string_view whole = last.substr(0, last.find_last_not_of(' ') + 1);
  line += output.paint(lastColour, cut(whole, left));
  return line.substr(0, line.find_last_not_of(' ') + 1);
}

Cell timeCell(platform::WallTime time) {
  return {clockTime(time), kTimeWidth, Colour::dim};
}

std::string memberText(const Dictionary& object, const char* key) {
  const auto found = object.is_object() ? object.find(key) : object.end();
  return found == object.end() || found->is_null() ? std::string() : plainText(*found);
}

/// What goes without saying.
bool saysNothing(const Dictionary& value) {
  const auto* text = value.get_ptr<const std::string*>();
  if (text != nullptr) return text->empty() || *text == "unknown";
  return value.is_null() || value == false || value == 0;
}

/// A value in few words.
std::string brief(const Dictionary& value) {
  if (value.is_array()) return fmt::format("[{}]", value.size());
  if (value.is_object()) return fmt::format("{{{}}}", value.size());
  const std::string text = plainText(value);
  return UUID::parse(text) ? text.substr(0, kGUIDWidth) : cut(text, kLongestValue);
}

/// The members that have no column of their own: what was typed, then plain ones, then the rest.
std::string members(const Dictionary& feedback) {
  std::array<std::string, 3> parts;
  for (const auto& [key, value] : feedback.items()) {
    if (key == "type" || key == "query_id" || key == "timestamp" || saysNothing(value)) continue;
    parts[key == "input" ? 0 : value.is_structured() ? 2 : 1] += printable(key) + "=" + brief(value) + "  ";
  }
  return parts[0] + parts[1] + parts[2];
}

/// The client's own part of an agent, which the daemon's and the device's stand before.
std::string clientOf(const std::string& agent) {
  const auto device = agent.find(") ");
  return agent.starts_with("Sabled/") && device != std::string::npos ? agent.substr(device + 2) : agent;
}

bool isError(std::string_view kind) {
  return kind.find("error") != std::string_view::npos;
}

std::string heading(const Output& output, std::vector<Cell> cells, std::string_view last) {
  for (Cell& cell : cells) cell.colour = Colour::bold;
  return row(output, cells, last, Colour::bold);
}

}  // namespace

std::string feedbackHeading(const Output& output) {
  return heading(output, {{"time", kTimeWidth}, {"kind", kKindWidth}, {"query", kQueryWidth, {}, true}},
                 "what");
}

std::string sessionHeading(const Output& output) {
  return heading(output,
                 {{"time", kTimeWidth},
                  {"records", kCountWidth, {}, true},
                  {"user", kGUIDWidth},
                  {"the one before ended by", kReasonWidth}},
                 "agent");
}

std::string feedbackRow(const Output& output, platform::WallTime time, const Dictionary& feedback) {
  const std::string kind = memberText(feedback, "type");
  const Dictionary query = feedback.is_object() ? feedback.value("query_id", Dictionary()) : Dictionary();
  return row(output,
             {timeCell(time),
              {kind, kKindWidth, isError(kind) ? Colour::red : Colour::cyan},
              {saysNothing(query) ? "" : plainText(query), kQueryWidth, Colour::none, true}},
             feedback.is_object() ? members(feedback) : plainText(feedback));
}

std::string sessionRow(const Output& output, platform::WallTime time, const Dictionary& envelope) {
  const auto records = envelope.is_object() ? envelope.find("fb") : envelope.end();
  if (records == envelope.end()) return row(output, {timeCell(time)}, plainText(envelope));
  return row(output,
             {timeCell(time),
              {std::to_string(records->size()), kCountWidth, Colour::cyan, true},
              {memberText(envelope, "user_guid").substr(0, kGUIDWidth), kGUIDWidth, Colour::dim},
              {memberText(envelope, "previous_session_end_reason"), kReasonWidth}},
             clientOf(memberText(envelope, "agent")));
}

std::string droppedRow(const Output& output, platform::WallTime time, std::uint64_t count) {
  return row(output, {timeCell(time)},
             fmt::format("{} records left out: they came faster than they were read", count), Colour::red);
}

}  // namespace sable::sablectl

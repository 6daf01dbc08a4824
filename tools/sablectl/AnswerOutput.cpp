#include "tools/sablectl/AnswerOutput.h"

#include <fmt/format.h>

#include <algorithm>
#include <cmath>
#include <nlohmann/json.hpp>

#include "SableKit/SBLError.h"
#include "platform/Lowercase.h"
#include "tools/sablectl/Text.h"

namespace sable::sablectl {
namespace {

constexpr std::size_t kMaximumDataBytes = 64u << 20;
/// Narrower columns tell nothing.
constexpr std::size_t kMinimumColumn = 10;

std::optional<Dictionary> parsedData(const Answer& answer) {
  if (!answer.reply || answer.reply->data == nullptr) return std::nullopt;
  auto parsed = parseJSON(*answer.reply->data, kMaximumDataBytes);
  if (!parsed) return std::nullopt;
  return std::move(*parsed);
}

Dictionary orNull(const std::optional<std::string>& text) {
  return text ? Dictionary(*text) : Dictionary(nullptr);
}

Dictionary headersDocument(const platform::HTTPHeaders& headers) {
  Dictionary object = Dictionary::object();
  for (const auto& [name, value] : headers.fields()) object[name] = value;
  return object;
}

Dictionary replyDocument(const Answer& answer) {
  const SBLReply& reply = *answer.reply;
  Dictionary data = nullptr;
  if (auto parsed = parsedData(answer)) {
    data = std::move(*parsed);
  } else if (reply.data != nullptr) {
    data = *reply.data;
  }
  Dictionary request = nullptr;
  if (const auto& sent = reply.httpRequest)
    request = {{"url", sent->url}, {"method", sent->method}, {"headers", headersDocument(sent->headers)}};
  Dictionary response = nullptr;
  if (const auto& received = reply.httpResponse)
    response = {{"url", received->url},
                {"status", received->status},
                {"headers", headersDocument(received->headers)}};
  return {{"scale", reply.scale},
          {"data", std::move(data)},
          {"source", orNull(sourceOf(answer))},
          {"http_request", std::move(request)},
          {"http_response", std::move(response)}};
}

std::string headerLine(const Output& output, const Answer& answer) {
  std::string line = output.paint(Colour::bold, fmt::format("query {}", answer.queryId));
  if (const auto source = sourceOf(answer)) line += "  " + *source;
  if (answer.reply && answer.reply->httpResponse)
    line += fmt::format("  HTTP {}", answer.reply->httpResponse->status);
  line += fmt::format("  {:.1f} ms", answer.milliseconds);
  if (answer.reply && answer.reply->data != nullptr)
    line += fmt::format("  {} bytes", answer.reply->data->size());
  return line;
}

std::string textMember(const Dictionary& object, std::string_view key) {
  return printable(stringMember(object, key).value_or(""));
}

bool isResultSet(const Dictionary& value) {
  return value.is_object() && value.contains("results") && value["results"].is_array();
}

/// Title, URL and description of each result share the width: the first two take what they need,
/// up to a third each.
void addResults(std::vector<std::string>& lines, const Output& output, const Dictionary& results) {
  const std::size_t third = std::max(output.width / 3, kMinimumColumn);
  std::vector<std::vector<std::string>> rows;
  for (const Dictionary& result : results) {
    rows.push_back({cut(textMember(result, "title"), third), cut(textMember(result, "url"), third),
                    textMember(result, "description")});
  }
  for (const std::string& line : aligned(rows))
    lines.push_back("  " + cut(line, std::max(output.width, kMinimumColumn) - 2));
  if (rows.empty()) lines.emplace_back("  no results");
}

void addResultSet(std::vector<std::string>& lines, const Output& output, const Dictionary& set) {
  lines.emplace_back();
  const std::string query = textMember(set, "query");
  if (!query.empty()) lines.push_back(output.paint(Colour::bold, cut(query, output.width)));
  addResults(lines, output, set["results"]);
}

void addData(std::vector<std::string>& lines, const Output& output, const Answer& answer) {
  const auto data = parsedData(answer);
  if (!data) {
    lines.push_back(answer.reply->data == nullptr ? "no data"
                                                  : printable(*answer.reply->data, Newlines::keep));
  } else if (data->is_array() && std::ranges::all_of(*data, isResultSet)) {
    if (data->empty()) lines.emplace_back("no results");
    for (const Dictionary& set : *data) addResultSet(lines, output, set);
  } else if (isResultSet(*data)) {
    addResultSet(lines, output, *data);
  } else {
    lines.push_back(indentedJSON(*data));
  }
}

}  // namespace

Dictionary answerDocument(const Answer& answer) {
  return {{"query_id", answer.queryId},
          {"reply", answer.reply ? replyDocument(answer) : Dictionary(nullptr)},
          {"error", answer.error ? encodeErrorForJSON(*answer.error) : Dictionary(nullptr)},
          {"milliseconds", std::round(answer.milliseconds * 1e3) / 1e3}};
}

std::optional<std::string> sourceOf(const Answer& answer) {
  if (!answer.reply || !answer.verbose) return std::nullopt;
  return answer.reply->httpRequest ? "network" : "cache";
}

std::optional<std::string> bestCompletion(const Answer& answer, std::string_view input) {
  const auto data = parsedData(answer);
  if (!data || !data->is_array() || data->empty()) return std::nullopt;
  const std::string typed = platform::lowercased(input);
  const auto completes = [&](const Dictionary& set) {
    return platform::lowercased(stringMember(set, "query").value_or("")).starts_with(typed);
  };
  const auto best = std::ranges::find_if(*data, completes);
  return stringMember(best == data->end() ? data->front() : *best, "query");
}

std::vector<std::string> answerLines(const Output& output, const Answer& answer) {
  std::vector<std::string> lines{headerLine(output, answer)};
  if (answer.reply) {
    addData(lines, output, answer);
  } else if (!answer.error) {
    lines.emplace_back("no reply: superseded, too short, or the bag does not allow it");
  }
  return lines;
}

}  // namespace sable::sablectl

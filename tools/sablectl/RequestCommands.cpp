#include <fmt/format.h>

#include <algorithm>
#include <map>
#include <nlohmann/json.hpp>

#include "SableKit/SBLRelayCoding.h"
#include "tools/sablectl/AnswerOutput.h"
#include "tools/sablectl/Commands.h"
#include "tools/sablectl/Text.h"

namespace sable::sablectl {
namespace {

ExitCode show(const Context& context, const Answer& answer) {
  if (context.output.json) {
    context.output.document(answerDocument(answer));
  } else {
    for (const std::string& line : answerLines(context.output, answer)) context.output.line(line);
  }
  return answer.error ? complainOf(context, *answer.error) : kExitSuccess;
}

/// The rows of `type`: known widths, for a row is shown as soon as its answer is there.
class TypedRows {
 public:
  TypedRows(const Output& output, std::size_t inputWidth) : output_(output), inputWidth_(inputWidth) {}

  void show(const std::string& input, const Answer& answer) {
    const std::string source = answer.error ? "error" : sourceOf(answer).value_or(answer.reply ? "?" : "-");
    ++counts_[source];
    milliseconds_.push_back(answer.milliseconds);
    if (output_.json) return streamed(input, answer);
    const std::string told =
        answer.error ? answer.error->description() : bestCompletion(answer, input).value_or("");
    const std::string time = fmt::format("{:>9.1f} ms", answer.milliseconds);
    const std::size_t taken = inputWidth_ + kSourceWidth + time.size() + 6;
    const std::size_t left = output_.width > taken ? output_.width - taken : kSourceWidth;
    const std::string line = fmt::format("{}  {}  {}  {}", padded(printable(input), inputWidth_),
                                         output_.paint(colourOf(source), padded(source, kSourceWidth)), time,
                                         cut(printable(told), left));
    output_.line(std::string_view(line).substr(0, line.find_last_not_of(' ') + 1));
  }

  void summarize() const {
    if (output_.json || milliseconds_.empty()) return;
    std::string line = fmt::format("{} keystrokes", milliseconds_.size());
    for (const auto& [source, count] : counts_) line += fmt::format(", {} {}", count, sourceInWords(source));
    auto sorted = milliseconds_;
    std::ranges::sort(sorted);
    line += fmt::format("; median {:.1f} ms, longest {:.1f} ms", sorted[sorted.size() / 2], sorted.back());
    output_.line(output_.paint(Colour::dim, line));
  }

 private:
  static constexpr std::size_t kSourceWidth = 7;  // "network"

  void streamed(const std::string& input, const Answer& answer) const {
    Dictionary document;
    document["input"] = input;
    document.update(answerDocument(answer));
    output_.streamDocument(document);
  }
  static Colour colourOf(const std::string& source) {
    if (source == "error") return Colour::red;
    return source == "network" ? Colour::cyan : source == "cache" ? Colour::green : Colour::dim;
  }
  static std::string sourceInWords(const std::string& source) {
    if (source == "network" || source == "cache") return "from " + source;
    return source == "error" ? "failed" : source == "-" ? "without reply" : "from somewhere";
  }

  const Output& output_;
  const std::size_t inputWidth_;
  std::map<std::string, int> counts_;
  std::vector<double> milliseconds_;
};

}  // namespace

ExitCode runRequest(const Context& context, const std::string& className,
                    const platform::RelayRecord& record) {
  return withSession(context,
                     [&](Session& session) { return show(context, session.request(className, record)); });
}

ExitCode runType(const Context& context, SBLSearchRequest request) {
  const std::string text = std::exchange(request.queryString, {});
  return withSession(context, [&](Session& session) {
    TypedRows rows(context.output, std::max<std::size_t>(displayWidth(printable(text)), 5));
    ExitCode worst = kExitSuccess;
    for (const std::string& character : characters(text)) {
      request.queryString += character;
      const Answer answer = session.request(request);
      ++request.queryId;
      rows.show(request.queryString, answer);
      if (answer.error) worst = exitCodeFor(*answer.error);
      if (worst == kExitTimeout) break;
    }
    rows.summarize();
    return worst;
  });
}

}  // namespace sable::sablectl

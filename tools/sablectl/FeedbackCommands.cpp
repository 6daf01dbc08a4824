#include <nlohmann/json.hpp>

#include "SableKit/SBLRelayCoding.h"
#include "SableKit/SBLRelayInterfaces.h"
#include "SableKit/messages/MessageJSON.h"
#include "tools/sablectl/Commands.h"
#include "tools/sablectl/SessionFile.h"
#include "tools/sablectl/Text.h"

namespace sable::sablectl {
namespace {

constexpr std::size_t kMaximumSessionBytes = 1u << 30;

void printSession(const Output& output, const Dictionary& file) {
  output.line(output.paint(Colour::bold, plainText(file["version"])));
  output.line(plainText(file["root"]));
  for (const Dictionary& record : file["records"]) output.line(plainText(record));
}

}  // namespace

ExitCode runReport(const Context& context, const FeedbackReport& report) {
  return withSession(context, [&](Session& session) {
    const auto result = session.call(kSBLDaemonRelay, SBLDaemonRelay::reportEvent,
                                     {std::uint64_t{0}, report.queryId, report.className,
                                      std::make_shared<const std::string>(report.bytes)});
    if (!result) return fail(context, result.error());
    const std::size_t size = report.bytes.size();
    if (context.output.json) {
      context.output.document({{"class", report.className}, {"query_id", report.queryId}, {"bytes", size}});
    } else {
      context.output.line("reported " + report.className + ", " + std::to_string(size) + " bytes");
    }
    return kExitSuccess;
  });
}

ExitCode runFeedback(const Context& context) {
  return withSession(context, [&](Session& session) {
    const auto result = session.call(kSBLDaemonRelay, SBLDaemonRelay::feedback, {});
    if (!result) return fail(context, result.error());
    if (const auto error = decodeError(std::get<platform::RelayRecord>((*result)[1]))) {
      return fail(context, *error);
    }
    Dictionary entries = Dictionary::array();
    for (const std::string& text : std::get<platform::RelayStrings>((*result)[0])) {
      const auto parsed = parseJSON(text, text.size());
      entries.push_back(parsed ? *parsed : Dictionary(text));
    }
    if (context.output.json) {
      context.output.document(entries);
    } else {
      for (const Dictionary& entry : entries) context.output.line(plainText(entry));
      if (entries.empty()) context.output.line("no feedback in memory");
    }
    return kExitSuccess;
  });
}

ExitCode runSessionFile(const Context& context, const std::filesystem::path& path) {
  const auto open = context.host.fileManager.openForReading(std::filesystem::absolute(path));
  if (!open) return fail(context, open.error());
  const auto bytes = (*open)->map(kMaximumSessionBytes);
  if (!bytes) return fail(context, bytes.error());
  const Dictionary file = sessionFileDocument(*bytes);
  if (context.output.json) {
    context.output.document(file);
  } else {
    printSession(context.output, file);
  }
  if (file["damage"].is_null()) return kExitSuccess;
  complain("stops at byte " + plainText(file["damage"]["offset"]) + ": " +
           plainText(file["damage"]["reason"]));
  return kExitError;
}

}  // namespace sable::sablectl

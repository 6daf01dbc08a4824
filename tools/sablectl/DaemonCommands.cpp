#include <fmt/format.h>

#include <algorithm>
#include <nlohmann/json.hpp>

#include "SableKit/SBLBag.h"
#include "SableKit/SBLError.h"
#include "SableKit/SBLRelayCoding.h"
#include "SableKit/SBLRelayInterfaces.h"
#include "tools/sablectl/Commands.h"
#include "tools/sablectl/RecordDocument.h"
#include "tools/sablectl/Text.h"

namespace sable::sablectl {
namespace {

constexpr std::size_t kMaximumBagBytes = 64u << 20;

/// Leaves of nested objects as rows of dotted key and value.
void flatten(const std::string& key, const Dictionary& value, std::vector<std::vector<std::string>>& rows) {
  if (!value.is_object() || value.empty()) {
    rows.push_back({printable(key), plainText(value)});
    return;
  }
  for (const auto& [name, member] : value.items())
    flatten(key.empty() ? name : key + "." + name, member, rows);
}

void printBag(const Output& output, const Dictionary& raw, const std::string& userAgent) {
  output.line(output.paint(Colour::bold, printable(userAgent)));
  std::vector<std::vector<std::string>> rows;
  flatten("", raw, rows);
  std::ranges::sort(rows);
  for (const std::string& line : aligned(rows)) output.line(line);
  const SBLBag bag(std::make_shared<const Dictionary>(raw), userAgent);
  for (const std::string& problem : bag.problems()) complain("bag: " + problem);
}

}  // namespace

ExitCode runBag(const Context& context) {
  return withSession(context, [&](Session& session) {
    const auto bag = session.bag();
    if (!bag) return fail(context, bag.error());
    const auto raw = parseJSON(bag->json, kMaximumBagBytes);
    if (!raw) return fail(context, raw.error());
    if (context.output.json) {
      context.output.document(*raw);
    } else {
      printBag(context.output, *raw, bag->userAgent);
    }
    return kExitSuccess;
  });
}

ExitCode runSessions(const Context& context) {
  return withSession(context, [&](Session& session) {
    const auto result = session.call(kSBLDaemonRelay, SBLDaemonRelay::listSessions, {});
    if (!result) return fail(context, result.error());
    const Dictionary sessions = recordDocuments(std::get<platform::RelayRecords>((*result)[0]));
    if (context.output.json) {
      context.output.document(sessions);
    } else {
      for (const std::string& line : tableLines(sessions)) context.output.line(line);
    }
    return kExitSuccess;
  });
}

}  // namespace sable::sablectl

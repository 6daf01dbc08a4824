#include <nlohmann/json.hpp>

#include "SableKit/SBLRelayInterfaces.h"
#include "tools/sablectl/Commands.h"
#include "tools/sablectl/PrivacyOutput.h"

namespace sable::sablectl {

ExitCode runPrivacy(const Context& context) {
  constexpr std::size_t kMaximumBytes = 16u << 20;
  return withSession(context, [&](Session& session) {
    const auto result = session.call(kSBLDiagnosticsRelay, SBLDiagnosticsRelay::privacy, {});
    if (!result) return fail(context, result.error());
    const auto report = parseJSON(std::get<std::string>((*result)[0]), kMaximumBytes);
    if (!report) return fail(context, report.error());
    if (context.output.json) {
      context.output.document(*report);
    } else {
      for (const std::string& line : privacyLines(context.output, *report)) context.output.line(line);
    }
    return kExitSuccess;
  });
}

}  // namespace sable::sablectl

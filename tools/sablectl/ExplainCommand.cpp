#include <fmt/format.h>

#include <nlohmann/json.hpp>

#include "SableKit/SBLRelayCoding.h"
#include "SableKit/SBLRelayInterfaces.h"
#include "tools/sablectl/Commands.h"
#include "tools/sablectl/ExplanationOutput.h"

namespace sable::sablectl {

ExitCode runExplain(const Context& context, SBLSearchRequest request, const std::string& before) {
  constexpr std::size_t kMaximumBytes = 64u << 20;
  return withSession(context, [&](Session& session) {
    if (!before.empty()) {
      SBLSearchRequest first = request;
      first.queryString = before;
      if (const Answer answer = session.request(first); answer.error) return fail(context, *answer.error);
      ++request.queryId;
    }
    const auto result = session.call(kSBLDiagnosticsRelay, SBLDiagnosticsRelay::explain,
                                     {std::string(SBLSearchRequest::kClassName), encodeRequest(request)});
    if (!result) return fail(context, result.error());
    const auto explanation = parseJSON(std::get<std::string>((*result)[0]), kMaximumBytes);
    if (!explanation) return fail(context, explanation.error());
    if (context.output.json) {
      context.output.document(*explanation);
    } else {
      for (const std::string& line : explanationLines(context.output, *explanation))
        context.output.line(line);
    }
    return kExitSuccess;
  });
}

}  // namespace sable::sablectl

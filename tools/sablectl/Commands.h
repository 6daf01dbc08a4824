#pragma once

#include <filesystem>
#include <optional>
#include <string>
#include <vector>

#include "SableKit/SBLImageDescription.h"
#include "tools/sablectl/Context.h"

/// What the tool does, a function a command. Each prints its result and says what to exit with.
namespace sable::sablectl {

// Requests.
ExitCode runRequest(const Context& context, const std::string& className,
                    const platform::RelayRecord& record);
/// Asks for "t", "te", "tex", "text" one after the other; query ids ascend from the request's.
ExitCode runType(const Context& context, SBLSearchRequest request);

struct ImageOptions {
  std::vector<SBLImageDescription> descriptions;
  std::filesystem::path save;  ///< folder for the images; empty: none
};
ExitCode runImages(const Context& context, const ImageOptions& options);

// What the daemon tells.
/// What a search would do, and why: nothing is asked of the service.
/// `before` is searched first, unless empty: the cache is its connection's.
ExitCode runExplain(const Context& context, SBLSearchRequest request, const std::string& before);
/// What requests would tell of this device now, and what changes that.
ExitCode runPrivacy(const Context& context);
ExitCode runBag(const Context& context);
ExitCode runSessions(const Context& context);
/// What sessions hold in memory.
ExitCode runFeedback(const Context& context);
ExitCode runResource(const Context& context, const std::string& identifier,
                     const std::optional<std::filesystem::path>& save);
/// The resources that the bag asks for: what is there of each, and what is planned.
ExitCode runResources(const Context& context);

struct FeedbackReport {
  std::string className;
  std::string bytes;  ///< the message
  std::int64_t queryId = 0;
};
ExitCode runReport(const Context& context, const FeedbackReport& report);

// The flusher control channel.
/// Shows every feedback as it is added, or every session as it is uploaded (`sent`), until the daemon
/// goes or an interrupt ends the process.
ExitCode runWatch(const Context& context, bool sent);
ExitCode runStop(const Context& context);
ExitCode runDump(const Context& context);

// What its files tell.
/// A session file, as far as it can be read; kExitError where that is not to its end.
ExitCode runSessionFile(const Context& context, const std::filesystem::path& path);
ExitCode runCounters(const Context& context, bool openMetrics);
/// What became of every feedback record; kExitError where the sums differ.
ExitCode runLedger(const Context& context);
ExitCode runStatus(const Context& context);
/// The uploads under way and the last ones.
ExitCode runUploads(const Context& context);
/// The JSON that an upload carries.
ExitCode runShowUpload(const Context& context, std::int64_t identifier);

}  // namespace sable::sablectl

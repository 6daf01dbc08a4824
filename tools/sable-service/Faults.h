#pragma once

#include <chrono>
#include <cstddef>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "Message.h"

namespace service {

/// What is to go wrong with one answer. The values are those of the rules that applied, a later one over an
/// earlier one of the same kind.
struct FaultPlan {
  std::chrono::milliseconds latency{0};
  std::optional<int> status;
  std::optional<std::string> redirect;
  std::optional<std::string> body;
  std::optional<std::string> retryAfter;
  std::optional<std::string> bagVersion;
  std::optional<size_t> truncateAfter;
  std::optional<size_t> bytesPerSecond;
  bool reset = false;
  /// The rules that applied, as they were given, for the record.
  std::vector<std::string> rules;

  /// True when the client is told that its request failed, so that nothing it sent may count as accepted.
  bool refuses() const { return status || redirect || retryAfter; }
  /// Status, redirection, body and retry-after; the rest is up to who sends the answer.
  void apply(Answer& answer) const;
};

/// The rules, in the order given: PATH:KIND[=VALUE][*COUNT][@SKIP].
///
/// PATH matches itself and what lies below it ("/images" matches "/images/a.png", "/" everything). A rule
/// passes over the first SKIP requests that match, then applies to COUNT of them (without COUNT to all).
/// VALUE ends at the last
/// "*COUNT" or "@SKIP". Kinds:
///
///   latency=MS          waits before the answer         truncate=BYTES     closes after that much of the
///   body status=CODE         this status, an error body      slow=BYTES         body at that many bytes a
///   second redirect=URL        302 with this Location          body=TEXT          this body instead
///   retry-after=SECONDS 503 with this Retry-After       reset              RST in place of an answer
///   version=VERSION     the bag has this version
///
/// Safe from any thread.
class Faults {
 public:
  /// The reason when the text is no rule.
  std::optional<std::string> add(const std::string& text);
  void clear();
  /// What goes wrong with this request; counts it.
  FaultPlan plan(const std::string& path);

 private:
  struct Rule {
    std::string text;
    std::string path;
    std::string kind;
    std::string value;
    size_t skip = 0;
    std::optional<size_t> count;
  };

  static void note(const Rule& rule, FaultPlan& plan);

  std::mutex mutex_;
  std::vector<Rule> rules_;
};

}  // namespace service

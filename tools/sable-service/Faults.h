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

/// What is to go wrong while the body of a request is read.
struct ReadingPlan {
  std::optional<size_t> resetAfter;
  std::optional<size_t> bytesPerSecond;
};

/// The rules, in the order given: PATH:KIND[=VALUE][*COUNT][@SKIP].
///
/// PATH matches itself and what lies below it ("/images" matches "/images/a.png", "/" everything). A rule
/// passes over the first SKIP requests that match, then applies to COUNT of them (without COUNT to all).
/// VALUE ends at the last
/// "*COUNT" or "@SKIP". Kinds:
///
///   latency=MS           waits before the answer
///   status=CODE          this status, an error body
///   redirect=URL         302 with this Location
///   retry-after=SECONDS  503 with this Retry-After, which may also be a date
///   body=TEXT            this body instead
///   truncate=BYTES       closes after that much of the answer's body
///   slow=BYTES           the answer's body at that many bytes a second
///   reset                RST in place of an answer
///   reset-body=BYTES     RST when that much of the request's body has been read
///   slow-body=BYTES      reads the request's body at that many bytes a second
///   version=VERSION      the bag has this version
///
/// Safe from any thread.
class Faults {
 public:
  /// The reason when the text is no rule.
  std::optional<std::string> add(const std::string& text);
  void clear();
  /// What goes wrong with this request; counts it.
  FaultPlan plan(const std::string& path);
  /// The same for a request whose body is still to be read.
  ReadingPlan planReading(const std::string& path);

 private:
  struct Rule {
    std::string text;
    std::string path;
    std::string kind;
    std::string value;
    size_t skip = 0;
    std::optional<size_t> count;
  };

  std::vector<Rule> applying(const std::string& path, bool reading);
  static void note(const Rule& rule, FaultPlan& plan);

  std::mutex mutex_;
  std::vector<Rule> rules_;
};

}  // namespace service

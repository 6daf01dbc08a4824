#pragma once

#include <cstdint>
#include <filesystem>
#include <mutex>
#include <optional>
#include <string>

#include "Message.h"

namespace service {

/// Writes every request as one JSON line to requests.jsonl in a folder, at once and in one write, so that who
/// reads the file while the service runs sees whole lines only. Safe from any thread; without a folder it
/// does nothing.
///
///   n           from 1 in the order of the lines
///   time        arrival, seconds since 1970 with microseconds
///   method, target, path, query    target as on the request line, path decoded, query raw
///   items       [[name, value], ...] decoded, in wire order
///   headers     [[name, value], ...] in arrival order, spelled as they came
///   body_bytes  length of the body as it came, before inflation
///   status      of the answer; with a reset, what it would have been
///   faults      the rules that applied, left out when none did
///   and what the endpoint adds: see Uploads.
class Recorder {
 public:
  Recorder() = default;
  ~Recorder();
  Recorder(const Recorder&) = delete;
  Recorder& operator=(const Recorder&) = delete;

  /// Makes the folder; the reason when the file cannot be opened.
  std::optional<std::string> open(const std::filesystem::path& folder);
  void write(double time, const Request& request, const Answer& answer,
             const std::vector<std::string>& faults);

 private:
  std::mutex mutex_;
  int file_ = -1;
  uint64_t count_ = 0;
};

}  // namespace service

#include "Recorder.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <unistd.h>

#include <cerrno>
#include <system_error>

namespace service {

namespace {

Json listOf(const Pairs& pairs) {
  Json list = Json::array();
  for (const auto& [name, value] : pairs) list.push_back({name, value});
  return list;
}

}  // namespace

Recorder::~Recorder() {
  if (file_ >= 0) ::close(file_);
}

std::optional<std::string> Recorder::open(const std::filesystem::path& folder) {
  std::error_code error;
  std::filesystem::create_directories(folder, error);
  const auto path = folder / "requests.jsonl";
  file_ = ::open(path.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
  if (file_ >= 0) return std::nullopt;
  return fmt::format("cannot write {}: {}", path.string(), std::generic_category().message(errno));
}

void Recorder::write(double time, const Request& request, const Answer& answer,
                     const std::vector<std::string>& faults) {
  if (file_ < 0) return;
  Json line = {{"n", 0},
               {"time", time},
               {"method", request.method},
               {"target", request.target},
               {"path", request.path},
               {"query", request.query},
               {"items", listOf(request.items)},
               {"headers", listOf(request.headers)},
               {"body_bytes", request.body.size()},
               {"status", answer.status}};
  if (!faults.empty()) line["faults"] = faults;
  line.update(answer.record);
  const std::lock_guard lock(mutex_);
  line["n"] = ++count_;
  const std::string text = toText(line) + "\n";
  if (::write(file_, text.data(), text.size()) < 0)
    fmt::print(stderr, "sable-service: cannot record a request\n");
}

}  // namespace service

#include "platform/host/HostLog.h"

#include <fmt/compile.h>
#include <fmt/format.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <syslog.h>
#include <unicode/uchar.h>
#include <unicode/utf8.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <cstdlib>
#include <string_view>

#define SD_JOURNAL_SUPPRESS_LOCATION  // of this file, always
#include <systemd/sd-journal.h>

namespace sable::platform::host {

namespace {

bool standardErrorIsTheJournal() {
  const char* stream = std::getenv("JOURNAL_STREAM");  // NOLINT(concurrency-mt-unsafe): nobody sets it
  struct stat status {};
  if (stream == nullptr || ::fstat(STDERR_FILENO, &status) != 0) return false;
  return stream == fmt::format("{}:{}", status.st_dev, status.st_ino);
}

int priority(LogLevel level) {
  switch (level) {
    case LogLevel::debug:
      return LOG_DEBUG;
    case LogLevel::info:
      return LOG_INFO;
    case LogLevel::standard:
      return LOG_NOTICE;
    case LogLevel::error:
      return LOG_ERR;
    case LogLevel::fault:
      return LOG_CRIT;
  }
  return LOG_NOTICE;
}

bool mayForge(UChar32 character) {
  return (U_MASK(u_charType(character)) & (U_GC_CC_MASK | U_GC_CF_MASK | U_GC_ZL_MASK | U_GC_ZP_MASK)) != 0;
}

/// What stands for itself: printable ASCII, which nearly all of a log is.
bool isPlain(char byte) {
  return byte >= ' ' && byte <= '~';
}

/// The character at `next`, which moves past it; negative for bytes that are no UTF-8.
UChar32 takeCharacter(std::string_view text, std::int64_t& next) {
  const char* bytes = text.data();
  const auto length = static_cast<std::int64_t>(text.size());
  UChar32 character = 0;
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wconversion"  // within the macro
  U8_NEXT(bytes, next, length, character);
#pragma GCC diagnostic pop
  return character;
}

void appendEscaped(fmt::memory_buffer& line, std::string_view text) {
  const auto out = std::back_inserter(line);
  const char* bytes = text.data();
  const auto length = static_cast<std::int64_t>(text.size());
  for (std::int64_t next = 0; next < length;) {
    const std::int64_t start = next;
    while (next < length && isPlain(bytes[next])) ++next;
    line.append(bytes + start, bytes + next);
    if (next > start) continue;
    const UChar32 character = takeCharacter(text, next);
    if (character == '\n') {
      fmt::format_to(out, "\\n");
    } else if (character < 0) {
      for (auto i = start; i < next; ++i)
        fmt::format_to(out, "\\x{:02x}", static_cast<unsigned char>(bytes[i]));
    } else if (mayForge(character)) {
      fmt::format_to(out, "\\u{{{:x}}}", static_cast<unsigned>(character));
    } else {
      line.append(bytes + start, bytes + next);
    }
  }
}

void appendTime(fmt::memory_buffer& line) {
  const auto now = std::chrono::floor<std::chrono::milliseconds>(std::chrono::system_clock::now());
  const auto midnight = std::chrono::floor<std::chrono::days>(now);
  const std::chrono::year_month_day date(midnight);
  const std::chrono::hh_mm_ss time(now - midnight);
  // Compiled: there is a line for every search.
  fmt::format_to(std::back_inserter(line), FMT_COMPILE("{:04}-{:02}-{:02}T{:02}:{:02}:{:02}.{:03}Z"),
                 int{date.year()}, unsigned{date.month()}, unsigned{date.day()}, time.hours().count(),
                 time.minutes().count(), time.seconds().count(), time.subseconds().count());
}

void writeLine(const LogRecord& record) {
  fmt::memory_buffer line;
  appendTime(line);
  fmt::format_to(std::back_inserter(line), FMT_COMPILE(" {:<5} {}: "), logLevelName(record.level),
                 record.category.empty() ? "default" : record.category);
  appendEscaped(line, record.message);
  line.push_back('\n');
  // A line that standard error does not take is lost: there is nowhere to say so.
  [[maybe_unused]] const ssize_t written = ::write(STDERR_FILENO, line.data(), line.size());
}

bool sendToJournal(const LogRecord& record) {
  fmt::memory_buffer message;
  message.append(std::string_view("MESSAGE="));
  appendEscaped(message, record.message);
  std::array<std::string, 4> fields{fmt::format("PRIORITY={}", priority(record.level)),
                                    fmt::format("SUBSYSTEM={}", record.subsystem), "SYSLOG_IDENTIFIER=sabled",
                                    fmt::format("CATEGORY={}", record.category)};
  std::array<iovec, fields.size() + 1> parts{};
  parts[0] = {message.data(), message.size()};
  for (std::size_t i = 0; i < fields.size(); ++i) parts[i + 1] = {fields[i].data(), fields[i].size()};
  return ::sd_journal_sendv(parts.data(), static_cast<int>(parts.size())) >= 0;
}

}  // namespace

HostLog::HostLog(LogLevel minimum, std::vector<std::string> categories)
    : minimum_(minimum), categories_(std::move(categories)), toJournal_(standardErrorIsTheJournal()) {}

bool HostLog::shows(LogLevel level, std::string_view category) const {
  if (level < minimum_) return false;
  const std::string_view name = category.empty() ? "default" : category;
  return categories_.empty() || std::find(categories_.begin(), categories_.end(), name) != categories_.end();
}

void HostLog::write(const LogRecord& record) {
  if (!toJournal_ || !sendToJournal(record)) writeLine(record);
}

}  // namespace sable::platform::host

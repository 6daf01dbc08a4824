#include <fmt/format.h>

#include <algorithm>
#include <nlohmann/json.hpp>

#include "SableKit/SBLFeedbackLedger.h"
#include "tools/sablectl/Commands.h"
#include "tools/sablectl/SessionFile.h"

namespace sable::sablectl {
namespace {

using enum SBLLedgerEntry;

struct Line {
  SBLLedgerEntry entry;
  std::string_view meaning;
};

constexpr Line kBeginnings[] = {
    {taken, "reported to a session"},
    {found, "in a file at a start, unknown to the counters"},
};

constexpr Line kEnds[] = {
    {bagDisabled, "dropped: the bag turns feedback off"},
    {noAgent, "dropped: no agent"},
    {noFile, "not written: no file could be made"},
    {sizeLimit, "not written: the session's file was full"},
    {unwritten, "not written: a write had failed"},
    {lostWriting, "lost: the daemon ended before writing"},
    {tooOld, "deleted: too old"},
    {tooLarge, "deleted: the file was too large"},
    {otherVersion, "deleted: of another build"},
    {damaged, "deleted: damaged"},
    {missing, "gone from the files while no daemon ran"},
    {unsent, "not sent: no endpoint, or not packed"},
    {lostSending, "lost: the daemon ended before sending"},
    {uploaded, "uploaded"},
    {refused, "upload refused or failed"},
};

/// The last word of an entry's key.
std::string nameOf(SBLLedgerEntry entry) {
  const auto key = counterOf(entry);
  return std::string(key.substr(key.rfind('.') + 1));
}

struct Stock {
  std::int64_t records = 0, files = 0;
};

/// A session that is written or complete, one that is on its way to an upload, or one for crowd sourcing.
bool isSessionFile(std::string_view name) {
  return name.starts_with("session.") || name.starts_with("flushing.") || name.starts_with("crowdsourcing.");
}

/// What session files hold now.
Stock stockOf(const Host& host) {
  constexpr std::size_t kMaximumSessionBytes = 1u << 30;
  Stock stock;
  for (const std::string& name : host.fileManager.list(host.caches).value_or(std::vector<std::string>())) {
    if (!isSessionFile(name)) continue;
    const auto file = host.fileManager.openForReading(host.caches / name);
    const auto bytes = file ? (*file)->map(kMaximumSessionBytes) : tl::unexpected(file.error());
    if (!bytes) continue;
    ++stock.files;
    stock.records += static_cast<std::int64_t>(recordsInSessionFile(*bytes));
  }
  return stock;
}

Dictionary documentOf(const Counters& counters, const SBLFeedbackLedger& ledger, const Stock& stock) {
  Dictionary document;
  for (const Line& line : kBeginnings) document["began"][nameOf(line.entry)] = ledger[line.entry];
  for (const Line& line : kEnds) document["ended"][nameOf(line.entry)] = ledger[line.entry];
  for (const Line& line : kEnds) {
    const std::string key(fileCounterOf(line.entry));
    if (!key.empty()) document["files"][nameOf(line.entry)] = counters.contains(key) ? counters.at(key) : 0;
  }
  document["waiting"] = ledger.waiting();
  document["stored"] = ledger.stored();
  document["sending"] = ledger.sending();
  document["in_files"] = stock.records;
  document["session_files"] = stock.files;
  document["difference"] = {{"waiting", ledger.waiting()}, {"in_files", stock.records - ledger.stored()}};
  document["meets"] = ledger.waiting() == 0 && stock.records == ledger.stored();
  return document;
}

void printTable(const Output& output, const Dictionary& document) {
  std::vector<std::vector<std::string>> rows;
  const auto add = [&](const std::string& name, const Dictionary& records, std::string_view meaning,
                       const Dictionary& files = nullptr) {
    rows.push_back({name, fmt::format("{:>12}", records.get<std::int64_t>()),
                    files.is_null() ? "" : fmt::format("{:>6}", files.get<std::int64_t>()),
                    std::string(meaning)});
  };
  rows.push_back({"", fmt::format("{:>12}", "records"), fmt::format("{:>6}", "files"), ""});
  for (const Line& line : kBeginnings)
    add(nameOf(line.entry), document["began"][nameOf(line.entry)], line.meaning);
  for (const Line& line : kEnds) {
    const std::string name = nameOf(line.entry);
    add(name, document["ended"][name], line.meaning, document["files"].value(name, Dictionary()));
  }
  add("stored", document["in_files"], "in session files now", document["session_files"]);
  add("sending", document["sending"], "handed over for sending, with no end yet");
  add("waiting", document["waiting"], "on the way to a file");
  for (const std::string& line : aligned(rows)) output.line(line);
}

void printVerdict(const Output& output, const Dictionary& document) {
  if (document["meets"].get<bool>()) return output.line(output.paint(Colour::green, "the sums meet"));
  const auto waiting = document["waiting"].get<std::int64_t>();
  const auto files = document["difference"]["in_files"].get<std::int64_t>();
  if (waiting != 0)
    output.line(
        output.paint(Colour::red, fmt::format("the sums differ by {}: records without an end yet; what a "
                                              "daemon that was killed leaves is settled at its next start",
                                              waiting)));
  if (files != 0)
    output.line(output.paint(Colour::red, fmt::format("the sums differ by {}: the files hold {} records, the "
                                                      "counters say {}",
                                                      files, document["in_files"].get<std::int64_t>(),
                                                      document["stored"].get<std::int64_t>())));
}

}  // namespace

ExitCode runLedger(const Context& context) {
  const auto counters = readCounters(context);
  if (!counters) return counters.error();
  const auto document = documentOf(*counters, SBLFeedbackLedger(*counters), stockOf(context.host));
  if (context.output.json) {
    context.output.document(document);
  } else {
    printTable(context.output, document);
    printVerdict(context.output, document);
  }
  return document["meets"].get<bool>() ? kExitSuccess : kExitError;
}

}  // namespace sable::sablectl

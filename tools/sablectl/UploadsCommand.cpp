#include "tools/sablectl/UploadsCommand.h"

#include <fmt/format.h>
#include <zlib.h>

#include <array>
#include <cerrno>
#include <chrono>
#include <cmath>
#include <nlohmann/json.hpp>

#include "tools/sablectl/Commands.h"
#include "tools/sablectl/Text.h"

namespace sable::sablectl {
namespace {

using platform::BackgroundTransfer;

constexpr std::size_t kMaximumUploadBytes = 64u << 20;
constexpr const char* kUploadErrorDomain = "UploadErrorDomain";

const char* stateOf(const BackgroundTransfer& transfer) {
  return transfer.ended ? "ended" : transfer.running ? "running" : "queued";
}

Dictionary documentOf(const Host& host, const KeptUpload& upload) {
  const BackgroundTransfer& transfer = upload.transfer;
  const auto& task = transfer.task;
  const auto time = [](platform::WallTime when) { return Dictionary(platform::secondsSince1970(when)); };
  const bool waits = !transfer.ended && !transfer.running;
  Dictionary document;
  document["id"] = task.identifier;
  document["state"] = stateOf(transfer);
  document["url"] = task.originalRequest.url;
  document["bytes"] = upload.size;
  document["accepted"] = time(transfer.accepted);
  document["attempts"] = transfer.attempts;
  document["next_attempt"] =
      waits ? time(transfer.attempts == 0 ? transfer.accepted : transfer.lastAttempt + transfer.pause)
            : Dictionary(nullptr);
  document["ended"] = transfer.ended ? time(transfer.lastAttempt) : Dictionary(nullptr);
  document["status"] = task.response ? Dictionary(task.response->status) : Dictionary(nullptr);
  document["error"] = transfer.error ? Dictionary(transfer.error->description()) : Dictionary(nullptr);
  document["can_be_shown"] = host.uploadBody(task.identifier).has_value();
  return document;
}

std::string resultOf(const BackgroundTransfer& transfer, platform::WallTime now) {
  if (transfer.error) return printable(transfer.error->description());
  std::string text = transfer.task.response ? fmt::format("status {}", transfer.task.response->status) : "";
  if (transfer.ended || transfer.running) return text;
  if (!text.empty()) text += ", ";
  const auto next = platform::toSeconds(transfer.lastAttempt + transfer.pause - now);
  if (transfer.attempts == 0 || next <= 0) return text + "waits for the daemon, power or a network";
  return text + "again in " + duration(std::llround(next));
}

void printTable(const Context& context, const std::vector<KeptUpload>& uploads) {
  const auto now = context.host.runtime.now();
  std::vector<std::vector<std::string>> rows{{"ID", "STATE", "BYTES", "ACCEPTED", "ATTEMPTS", "RESULT"}};
  for (const KeptUpload& upload : uploads) {
    const BackgroundTransfer& transfer = upload.transfer;
    const auto age = std::chrono::round<std::chrono::seconds>(now - transfer.accepted).count();
    rows.push_back({std::to_string(transfer.task.identifier), stateOf(transfer), std::to_string(upload.size),
                    duration(age) + " ago", std::to_string(transfer.attempts), resultOf(transfer, now)});
  }
  if (uploads.empty()) return context.output.line("nothing was uploaded yet");
  for (const std::string& line : aligned(rows)) context.output.line(line);
}

}  // namespace

Expected<std::string> inflateUpload(std::string_view body) {
  z_stream stream{};
  if (inflateInit2(&stream, -MAX_WBITS) != Z_OK) {
    return tl::unexpected(Error{kUploadErrorDomain, Z_MEM_ERROR, "no memory to inflate it"});
  }
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(body.data()));
  stream.avail_in = static_cast<uInt>(body.size());
  std::string text;
  std::array<char, 65536> buffer{};
  int status = Z_OK;
  while (status == Z_OK && text.size() <= kMaximumUploadBytes) {
    stream.next_out = reinterpret_cast<Bytef*>(buffer.data());
    stream.avail_out = buffer.size();
    status = inflate(&stream, Z_NO_FLUSH);
    text.append(buffer.data(), buffer.size() - stream.avail_out);
  }
  inflateEnd(&stream);
  if (status == Z_STREAM_END && text.size() <= kMaximumUploadBytes) return text;
  return tl::unexpected(Error{kUploadErrorDomain, status, "it is no DEFLATE stream of at most 64 MiB"});
}

ExitCode runUploads(const Context& context) {
  auto uploads = context.host.readUploads();
  // Without a file nothing was ever uploaded.
  if (!uploads && uploads.error().code == ENOENT) uploads.emplace();
  if (!uploads) return fail(context, uploads.error());
  if (!context.output.json) {
    printTable(context, *uploads);
    return kExitSuccess;
  }
  Dictionary documents = Dictionary::array();
  for (const KeptUpload& upload : *uploads) documents.push_back(documentOf(context.host, upload));
  context.output.document(documents);
  return kExitSuccess;
}

ExitCode runShowUpload(const Context& context, std::int64_t identifier) {
  const auto path = context.host.uploadBody(identifier);
  if (!path) {
    return fail(context,
                {kUploadErrorDomain, ENOENT, fmt::format("the body of upload {} is not kept", identifier)});
  }
  const auto body = context.host.fileManager.read(*path, kMaximumUploadBytes);
  const auto text = body ? inflateUpload(*body) : tl::unexpected(body.error());
  if (!text) return fail(context, text.error());
  context.output.line(context.output.json ? *text : printable(*text, Newlines::keep));
  return kExitSuccess;
}

}  // namespace sable::sablectl

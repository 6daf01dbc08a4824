#include <fmt/format.h>
#include <unistd.h>

#include <cerrno>
#include <cmath>
#include <fstream>
#include <nlohmann/json.hpp>

#include "SableKit/SBLError.h"
#include "SableKit/SBLRelayCoding.h"
#include "SableKit/SBLRelayInterfaces.h"
#include "tools/sablectl/Commands.h"
#include "tools/sablectl/RecordDocument.h"
#include "tools/sablectl/Text.h"

namespace sable::sablectl {
namespace {

using platform::RelayRecord;

constexpr std::size_t kMaximumBytes = 64u << 20;

Expected<std::uint64_t> copyFile(int descriptor, const std::optional<std::filesystem::path>& save) {
  std::ofstream file;
  if (save) file.open(*save, std::ios::binary | std::ios::trunc);
  if (save && !file) return tl::unexpected(posixError(errno, save->string()));
  std::uint64_t size = 0;
  char bytes[65536];
  for (ssize_t count; (count = pread(descriptor, bytes, sizeof bytes, static_cast<off_t>(size))) != 0;) {
    if (count < 0) return tl::unexpected(posixError(errno, "read"));
    size += static_cast<std::uint64_t>(count);
    if (save) file.write(bytes, count);
  }
  if (save && !file.flush()) return tl::unexpected(posixError(EIO, save->string()));
  return size;
}

std::string ageText(double created, const Context& context) {
  return duration(std::llround(platform::secondsSince1970(context.host.runtime.now()) - created));
}

std::string stateText(const Dictionary& resource) {
  const auto startsIn = numberMember(resource, "starts_in");
  if (!startsIn) return plainText(resource["state"]);
  return fmt::format("starts in {} ({})", duration(std::llround(*startsIn)), plainText(resource["reason"]));
}

/// What the daemon told of a resource, as a row for a person.
Dictionary rowOf(const Dictionary& resource, const Context& context) {
  const auto orDash = [&](const char* key) {
    const auto found = resource.find(key);
    return found == resource.end() || found->is_null() ? Dictionary("-") : *found;
  };
  const auto created = numberMember(resource, "created");
  Dictionary row;
  row["identifier"] = orDash("identifier");
  row["version"] = orDash("version");
  row["size"] = orDash("size");
  row["age"] = created ? ageText(*created, context) : "-";
  row["state"] = stateText(resource);
  row["url"] = orDash("url");
  return row;
}

}  // namespace

ExitCode runResource(const Context& context, const std::string& identifier,
                     const std::optional<std::filesystem::path>& save) {
  return withSession(context, [&](Session& session) {
    const auto result =
        session.call(kSBLDaemonRelay, SBLDaemonRelay::fileHandleAndAttributesForResource, {identifier});
    if (!result) return fail(context, result.error());
    if (const auto error = decodeError(std::get<RelayRecord>((*result)[2]))) return fail(context, *error);
    const auto& file = std::get<platform::RelayFile>((*result)[0]);
    if (file.descriptor == nullptr)
      return fail(context, makeSBLError(SBLErrorCode::daemonSide, "no file for " + identifier));
    const auto size = copyFile(*file.descriptor, save);
    if (!size) return fail(context, size.error());

    Dictionary document;
    document["identifier"] = identifier;
    document["bytes"] = *size;
    if (save) document["saved"] = save->string();
    document["attributes"] = recordDocument(std::get<RelayRecord>((*result)[1]));
    if (context.output.json) {
      context.output.document(document);
    } else {
      std::vector<std::vector<std::string>> rows{{"identifier", printable(identifier)},
                                                 {"bytes", fmt::format("{}", *size)}};
      if (const auto created = numberMember(document["attributes"], "creationDate"))
        rows.push_back({"age", ageText(*created, context)});
      if (save) rows.push_back({"saved", printable(save->string())});
      for (const std::string& line : aligned(rows)) context.output.line(line);
    }
    return kExitSuccess;
  });
}

ExitCode runResources(const Context& context) {
  return withSession(context, [&](Session& session) {
    const auto result = session.call(kSBLDiagnosticsRelay, SBLDiagnosticsRelay::resources, {});
    if (!result) return fail(context, result.error());
    const auto resources = parseJSON(std::get<std::string>((*result)[0]), kMaximumBytes);
    if (!resources) return fail(context, resources.error());
    if (context.output.json) {
      context.output.document(*resources);
      return kExitSuccess;
    }
    Dictionary rows = Dictionary::array();
    for (const Dictionary& resource : *resources) rows.push_back(rowOf(resource, context));
    for (const std::string& line : tableLines(rows)) context.output.line(line);
    return kExitSuccess;
  });
}

}  // namespace sable::sablectl

#include <fmt/format.h>

#include <nlohmann/json.hpp>

#include "tools/sablectl/Commands.h"
#include "tools/sablectl/ImageFile.h"
#include "tools/sablectl/Text.h"

namespace sable::sablectl {
namespace {

/// One row: {"url" or "id", "bytes", "type", "file"}; null for what is absent.
Expected<Dictionary> rowOf(const SBLImageDescription& description, const SBLClient::Images& images,
                           const std::filesystem::path& save) {
  const std::string& name = description.url ? *description.url : *description.id;
  Dictionary row;
  row[description.url ? "url" : "id"] = name;
  row["bytes"] = nullptr;
  row["type"] = nullptr;
  const auto found = images.find(name);
  if (found == images.end()) return row;
  row["bytes"] = found->second->size();
  row["type"] = imageType(*found->second);
  if (save.empty()) return row;
  const auto path = saveImage(save, imageFileName(name), *found->second);
  if (!path) return tl::unexpected(path.error());
  row["file"] = path->string();
  return row;
}

void printRows(const Output& output, const Dictionary& rows) {
  std::vector<std::vector<std::string>> cells;
  for (const Dictionary& row : rows) {
    const bool there = row["bytes"].is_number();
    cells.push_back({printable(row.begin()->get<std::string>()), there ? row["bytes"].dump() : "-",
                     there ? row["type"].get<std::string>() : "-"});
    if (row.contains("file")) cells.back().push_back(printable(row["file"].get<std::string>()));
  }
  for (const std::string& line : aligned(cells)) output.line(line);
}

}  // namespace

ExitCode runImages(const Context& context, const ImageOptions& options) {
  return withSession(context, [&](Session& session) {
    const auto images = session.loadImages(options.descriptions);
    if (!images) return fail(context, images.error());
    Dictionary rows = Dictionary::array();
    std::size_t missing = 0;
    for (const SBLImageDescription& description : options.descriptions) {
      auto row = rowOf(description, *images, options.save);
      if (!row) return fail(context, row.error());
      missing += (*row)["bytes"].is_null() ? 1 : 0;
      rows.push_back(std::move(*row));
    }
    if (context.output.json) {
      context.output.document({{"images", rows}, {"missing", missing}});
    } else {
      printRows(context.output, rows);
    }
    if (missing == 0) return kExitSuccess;
    complain(fmt::format("{} of {} images did not come: the daemon's log says why", missing, rows.size()));
    return kExitError;
  });
}

}  // namespace sable::sablectl

#include "tools/sablectl/ImageFile.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>

namespace sable::sablectl {
namespace {

constexpr std::size_t kMaximumNameBytes = 100;
constexpr int kMaximumNumber = 1000;

using namespace std::string_view_literals;

struct Signature {
  std::size_t offset;
  std::string_view bytes;
  std::string_view type;
};

constexpr Signature kSignatures[] = {
    {0, "\x89PNG\r\n\x1a\n"sv, "png"},
    {0, "\xff\xd8\xff"sv, "jpeg"},
    {0, "GIF8"sv, "gif"},
    {8, "WEBP"sv, "webp"},
    {4, "ftypavif"sv, "avif"},
    {0, "BM"sv, "bmp"},
    {0, "\0\0\1\0"sv, "ico"},
    {0, "<svg"sv, "svg"},
};

bool isPlain(char c) {
  return (c >= '0' && c <= '9') || (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || c == '-' || c == '_' ||
         c == '.';
}

/// The descriptor of a file that was not there before, or an error.
Expected<int> createFile(const std::filesystem::path& path) {
  const int file = open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
  if (file < 0) return tl::unexpected(posixError(errno, path.string()));
  return file;
}

Expected<void> writeAll(int file, std::string_view bytes) {
  while (!bytes.empty()) {
    const ssize_t count = write(file, bytes.data(), bytes.size());
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return tl::unexpected(posixError(errno, "write"));
    bytes.remove_prefix(static_cast<std::size_t>(count));
  }
  return {};
}

}  // namespace

std::string_view imageType(std::string_view bytes) {
  for (const auto& [offset, signature, type] : kSignatures) {
    if (bytes.size() > offset && bytes.substr(offset).starts_with(signature)) return type;
  }
  return "?";
}

std::string imageFileName(std::string_view text) {
  text = text.substr(0, text.find_first_of("?#"));
  std::string name(text.substr(text.find_last_of('/') + 1));
  std::ranges::replace_if(
      name, [](char c) { return !isPlain(c); }, '_');
  name.erase(0, name.find_first_not_of('.'));
  name.resize(std::min(name.size(), kMaximumNameBytes));
  return name.empty() ? "image" : name;
}

Expected<std::filesystem::path> saveImage(const std::filesystem::path& folder, const std::string& name,
                                          std::string_view bytes) {
  if (mkdir(folder.c_str(), 0700) != 0 && errno != EEXIST) {
    return tl::unexpected(posixError(errno, folder.string()));
  }
  const std::filesystem::path plain(name);
  std::filesystem::path path = folder / plain;
  auto file = createFile(path);
  for (int number = 2; !file && file.error().code == EEXIST && number <= kMaximumNumber; ++number) {
    path = folder / fmt::format("{}-{}{}", plain.stem().string(), number, plain.extension().string());
    file = createFile(path);
  }
  if (!file) return tl::unexpected(file.error());
  const auto written = writeAll(*file, bytes);
  close(*file);
  if (written) return path;
  unlink(path.c_str());
  return tl::unexpected(written.error());
}

}  // namespace sable::sablectl

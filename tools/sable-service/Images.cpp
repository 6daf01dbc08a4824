#include "Images.h"

#include <zlib.h>

#include <algorithm>
#include <cctype>
#include <charconv>
#include <cstdint>
#include <vector>

namespace service {

namespace {

constexpr uint32_t kSide = 64;
constexpr uint32_t kTile = 8;
constexpr size_t kLargest = size_t{256} << 20;

void putBigEndian(std::string& out, uint32_t value) {
  for (int shift = 24; shift >= 0; shift -= 8) out += static_cast<char>(value >> shift);
}

uint32_t checksum(const std::string& bytes) {
  return static_cast<uint32_t>(crc32_z(0, reinterpret_cast<const Bytef*>(bytes.data()), bytes.size()));
}

void putChunk(std::string& out, const std::string& type, const std::string& data) {
  putBigEndian(out, static_cast<uint32_t>(data.size()));
  out += type + data;
  putBigEndian(out, checksum(type + data));
}

std::string compressed(const std::string& bytes) {
  uLongf length = compressBound(bytes.size());
  std::string result(length, '\0');
  compress(reinterpret_cast<Bytef*>(result.data()), &length, reinterpret_cast<const Bytef*>(bytes.data()),
           bytes.size());
  result.resize(length);
  return result;
}

/// Rows of RGB pixels, each behind a filter byte of 0: tiles in two colours, mirrored left to right.
std::string pixels(uint32_t seed) {
  const uint32_t ink = seed * 2654435761U;
  const uint32_t paper = ~ink | 0xC0C0C0U;
  std::string rows;
  for (uint32_t y = 0; y < kSide; ++y) {
    rows += '\0';
    for (uint32_t x = 0; x < kSide; ++x) {
      const uint32_t column = std::min(x, kSide - 1 - x) / kTile;
      const bool inked = (seed >> ((y / kTile * 4 + column) % 32) & 1U) != 0;
      const uint32_t colour = inked ? ink : paper;
      for (int shift = 16; shift >= 0; shift -= 8) rows += static_cast<char>(colour >> shift);
    }
  }
  return rows;
}

bool isName(const std::string& name) {
  return !name.empty() && name.size() <= 200 && std::ranges::all_of(name, [](char c) {
    return std::isalnum(static_cast<unsigned char>(c)) != 0 ||
           std::string_view("._+-").find(c) != std::string_view::npos;
  });
}

}  // namespace

std::string drawImage(const std::string& name) {
  std::string header;
  putBigEndian(header, kSide);
  putBigEndian(header, kSide);
  header += std::string("\x08\x02\x00\x00\x00", 5);  // 8 bits, RGB, deflate, adaptive filters, not interlaced
  std::string png = "\x89PNG\r\n\x1a\n";
  putChunk(png, "IHDR", header);
  putChunk(png, "tEXt", std::string("Title\0", 6) + name);
  putChunk(png, "IDAT", compressed(pixels(checksum(name))));
  putChunk(png, "IEND", "");
  return png;
}

Answer imageAnswer(const Request& request) {
  const std::string name = request.path.substr(std::string_view("/images/").size());
  if (!isName(name)) return Answer::error(404, "there is no such image");
  if (const auto target = request.item("to"); target && name == "redirect") {
    Answer answer = Answer::empty(302);
    answer.headers.emplace_back("Location", *target);
    return answer;
  }
  std::string image = drawImage(name);
  if (const auto text = request.item("bytes")) {
    size_t length = 0;
    const auto [end, error] = std::from_chars(text->data(), text->data() + text->size(), length);
    const bool isNumber = error == std::errc() && end == text->data() + text->size();
    if (!isNumber || length < image.size() || length > kLargest) return Answer::error(400, "bytes is wrong");
    image.resize(length);
  }
  return Answer::tagged(request, "image/png", std::move(image), "public, max-age=86400");
}

}  // namespace service

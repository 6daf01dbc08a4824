#include "sabled/AppWhitelist.h"

#include <openssl/evp.h>
#include <simdjson.h>
#include <zlib.h>

#include <algorithm>
#include <charconv>
#include <cmath>
#include <map>
#include <vector>

#include "platform/ApplicationRegistry.h"
#include "platform/Dictionary.h"
#include "sabled/RunLengthCode.h"
#include "sabled/SableLogging.h"

namespace sable {
namespace {

using simdjson::dom::array;
using simdjson::dom::element;
using simdjson::dom::object;

constexpr double kHighestId = kMaximumBitmapBytes * 8;

std::nullopt_t malformed(std::string_view why) {
  SableLogForCategory(SableLoggingCategorySable).error("malformed app whitelist: {}", why);
  return std::nullopt;
}

/// The object that `text` is; `parser` holds it.
std::optional<object> parseObject(simdjson::dom::parser& parser, std::string_view text) {
  object root;
  auto failure = parser.allocate(std::max<std::size_t>(text.size(), 64), kMaximumJSONDepth);
  if (failure == simdjson::SUCCESS) failure = parser.parse(text.data(), text.size()).get(root);
  if (failure != simdjson::SUCCESS) return malformed(simdjson::error_message(failure));
  return root;
}

std::optional<std::string_view> string(const object& parent, std::string_view key) {
  std::string_view text;
  return parent[key].get(text) == simdjson::SUCCESS ? std::optional(text) : std::nullopt;
}

std::optional<double> encodingId(const element& entry) {
  array versions;
  if (entry.get(versions) != simdjson::SUCCESS) return std::nullopt;
  std::optional<double> id;
  for (const element version : versions) {
    double number = 0;
    id = version["encoding_id"].get(number) == simdjson::SUCCESS ? std::optional(number) : std::nullopt;
  }
  return id;
}

/// The installed applications that are in `apps`, with their numbers.
std::map<std::string, std::optional<double>, std::less<>> installedIds(
    const object& apps, platform::ApplicationRegistry& registry) {
  std::map<std::string, std::optional<double>, std::less<>> idByIdentifier;
  for (platform::InstalledApplication& application : registry.installedApplications()) {
    if (application.bundleIdentifier.empty() || application.bundleVersion.empty()) continue;
    idByIdentifier.try_emplace(std::move(application.bundleIdentifier));
  }
  for (const auto [identifier, entry] : apps) {
    const auto found = idByIdentifier.find(identifier);
    if (found != idByIdentifier.end()) found->second = encodingId(entry);
  }
  std::erase_if(idByIdentifier, [](const auto& application) { return !application.second; });
  return idByIdentifier;
}

std::vector<std::uint8_t> bitmapOf(const std::vector<double>& ids) {
  const auto highest = static_cast<std::size_t>(*std::ranges::max_element(ids));
  // Peers expect this length, although a highest number that divides by 8 has no bit in it.
  std::vector<std::uint8_t> bitmap((highest + 7) / 8);
  for (const double id : ids) {
    const auto bit = static_cast<std::size_t>(id);
    if (bit / 8 < bitmap.size()) bitmap[bit / 8] |= static_cast<std::uint8_t>(0x80 >> (bit % 8));
  }
  return bitmap;
}

std::optional<std::vector<std::uint8_t>> bytesOfHexadecimal(std::string_view text) {
  if (text.empty() || text.size() % 2 != 0) return std::nullopt;
  std::vector<std::uint8_t> bytes(text.size() / 2);
  for (std::size_t i = 0; i < bytes.size(); ++i) {
    const char* const pair = text.data() + 2 * i;
    if (std::from_chars(pair, pair + 2, bytes[i], 16).ptr != pair + 2) return std::nullopt;
  }
  return bytes;
}

void appendBigEndian(unsigned long number, unsigned bytes, std::vector<std::uint8_t>& out) {
  while (bytes-- > 0) out.push_back(static_cast<std::uint8_t>(number >> (8 * bytes)));
}

std::string base64(const std::vector<std::uint8_t>& bytes) {
  std::string text((bytes.size() + 2) / 3 * 4 + 1, '\0');  // and the NUL that is written behind it
  const int length = EVP_EncodeBlock(reinterpret_cast<unsigned char*>(text.data()), bytes.data(),
                                     static_cast<int>(bytes.size()));
  text.resize(static_cast<std::size_t>(length));
  return text;
}

}  // namespace

std::optional<AppWhitelistSignature> processWhitelist(std::string_view stream,
                                                      platform::ApplicationRegistry& registry) {
  if (stream.size() > kMaximumWhitelistBytes) return malformed("too long");
  simdjson::dom::parser outerParser, innerParser;
  const auto outer = parseObject(outerParser, stream);
  if (!outer) return std::nullopt;
  const auto text = string(*outer, "apps");
  if (!text || string(*outer, "compression") != "RLE" || string(*outer, "encoding") != "bitmap") {
    return malformed("not apps in a bitmap of compression RLE");
  }
  const auto inner = parseObject(innerParser, *text);
  if (!inner) return std::nullopt;
  const auto version = string(*inner, "version");
  object apps;
  if (!version || (*inner)["apps"].get(apps) != simdjson::SUCCESS) return malformed("no version or no apps");

  std::vector<double> ids;
  std::vector<std::string> applications;
  for (const auto& [identifier, id] : installedIds(apps, registry)) {
    applications.push_back(identifier);
    ids.push_back(*id);
  }
  if (ids.empty()) return std::nullopt;
  const bool allFit =
      std::ranges::all_of(ids, [](double id) { return id >= 0 && id <= kHighestId && std::floor(id) == id; });
  if (!allFit) return malformed("an encoding_id that is no integer of 0 to 524280");
  const std::vector<std::uint8_t> bitmap = bitmapOf(ids);
  std::vector<std::uint8_t> blob;
  const bool compressed = rle_compress(bitmap, blob);
  auto signature = makeSignature(static_cast<std::uint16_t>(bitmap.size()), blob, compressed, *version);
  if (!signature) return std::nullopt;
  return AppWhitelistSignature{std::move(*signature), std::move(applications)};
}

std::optional<std::string> makeSignature(std::uint16_t bitmapLength, std::span<const std::uint8_t> blob,
                                         bool compressed, std::string_view version) {
  const auto versionBytes = bytesOfHexadecimal(version);
  if (!versionBytes) return malformed("a version that is not pairs of hexadecimal digits");
  const unsigned secondToLast = versionBytes->size() < 2 ? 0 : (*versionBytes)[versionBytes->size() - 2];
  std::vector<std::uint8_t> signedBytes;
  signedBytes.reserve(4 + blob.size());
  appendBigEndian((compressed ? 0x80u : 0u) | (secondToLast & 0x7fu), 1, signedBytes);
  appendBigEndian(versionBytes->back(), 1, signedBytes);
  appendBigEndian(bitmapLength, 2, signedBytes);
  signedBytes.insert(signedBytes.end(), blob.begin(), blob.end());

  std::vector<std::uint8_t> buffer;
  appendBigEndian(crc32_z(0, signedBytes.data(), signedBytes.size()), 4, buffer);
  buffer.insert(buffer.end(), signedBytes.begin(), signedBytes.end());
  return base64(buffer);
}

}  // namespace sable

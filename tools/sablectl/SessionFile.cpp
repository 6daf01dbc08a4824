#include "tools/sablectl/SessionFile.h"

#include <algorithm>
#include <cstring>
#include <nlohmann/json.hpp>

#include "SableKit/messages/MessageJSON.h"

namespace sable::sablectl {
namespace {

constexpr std::size_t kLengthBytes = 8;

/// Walks the records of a file.
class Records {
 public:
  explicit Records(std::string_view bytes) : bytes_(bytes) {}

  bool atEnd() const { return position_ == bytes_.size(); }
  std::uint64_t position() const { return position_; }

  /// The record's payload; the error says what is missing, and the position stays.
  Expected<std::string_view> next() {
    const std::string_view rest = bytes_.substr(position_);
    if (rest.size() < kLengthBytes) return torn("a length of 8 bytes", rest.size());
    std::uint64_t length = 0;
    std::memcpy(&length, rest.data(), sizeof length);
    if (length > rest.size() - kLengthBytes) {
      return torn("a record of " + std::to_string(length) + " bytes", rest.size() - kLengthBytes);
    }
    position_ += kLengthBytes + length;
    return rest.substr(kLengthBytes, length);
  }

 private:
  static tl::unexpected<Error> torn(const std::string& wanted, std::size_t left) {
    return tl::unexpected(Error{"SessionFile", 1, wanted + " expected, " + std::to_string(left) + " left"});
  }

  const std::string_view bytes_;
  std::uint64_t position_ = 0;
};

Expected<Dictionary> rootDocument(std::string_view bytes) {
  const auto json = messageToJSON("_SKClientSession", bytes);
  if (!json) return tl::unexpected(json.error());
  return parseJSON(*json, json->size());
}

/// Reads one record after the other; the error says why it had to stop.
Expected<void> readRecords(Records& records, Dictionary& document, std::uint64_t& begin) {
  const auto next = [&] {
    begin = records.position();
    return records.next();
  };
  const auto version = next();
  if (!version) return tl::unexpected(version.error());
  document["version"] = *version;
  const auto rootBytes = next();
  if (!rootBytes) return tl::unexpected(rootBytes.error());
  auto root = rootDocument(*rootBytes);
  if (!root) return tl::unexpected(root.error());
  document["root"] = std::move(*root);
  while (!records.atEnd()) {
    const auto bytes = next();
    if (!bytes) return tl::unexpected(bytes.error());
    auto record = feedbackRecordDocument(*bytes);
    if (!record) return tl::unexpected(record.error());
    document["records"].push_back(std::move(*record));
  }
  return {};
}

}  // namespace

Dictionary sessionFileDocument(std::string_view bytes) {
  Dictionary document{
      {"version", nullptr}, {"root", nullptr}, {"records", Dictionary::array()}, {"damage", nullptr}};
  Records records(bytes);
  std::uint64_t begin = 0;
  if (const auto read = readRecords(records, document, begin); !read) {
    document["damage"] = {{"offset", begin}, {"reason", read.error().reason}};
  }
  return document;
}

std::size_t recordsInSessionFile(std::string_view bytes) {
  constexpr std::size_t kVersionAndRoot = 2;
  Records records(bytes);
  std::size_t count = 0;
  for (auto record = records.next(); record && !record->empty(); record = records.next()) ++count;
  return count - std::min(count, kVersionAndRoot);
}

}  // namespace sable::sablectl

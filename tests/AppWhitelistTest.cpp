#include <fmt/format.h>
#include <gtest/gtest.h>

#include <random>

#include "platform/simulated/SimulatedPlatform.h"
#include "sabled/AppWhitelist.h"
#include "sabled/AppWhitelistController.h"
#include "sabled/DownloadManager.h"
#include "sabled/RunLengthCode.h"
#include "tests/support/VirtualDevice.h"

namespace sable::test {
namespace {

using platform::InstalledApplication;
using platform::simulated::SimulatedApplicationRegistry;
using Bytes = std::vector<std::uint8_t>;

constexpr std::string_view kNone = "none";

/// An allow-list in which application "N" has the number N.
std::string whitelist(const std::vector<std::string>& ids, const std::string& version = "0a1b") {
  json apps = json::object();
  for (const std::string& id : ids) apps[id] = json::array({1, {{"encoding_id", json::parse(id)}}});
  const json inner{{"version", version}, {"apps", apps}};
  return json{{"apps", inner.dump()}, {"compression", "RLE"}, {"encoding", "bitmap"}}.dump();
}

std::string signatureOf(std::string_view list, const std::vector<std::string>& installed) {
  platform::simulated::SimulatedPlatform device;
  std::vector<InstalledApplication> applications;
  for (const std::string& identifier : installed) applications.push_back({identifier, "1.0"});
  device.applicationRegistry().change(std::move(applications));
  const auto signature = processWhitelist(list, device.applicationRegistry());
  return signature ? signature->text : std::string(kNone);
}

std::vector<std::string> numbers(int first, int last) {
  std::vector<std::string> all;
  for (int i = first; i <= last; ++i) all.push_back(std::to_string(i));
  return all;
}

TEST(AppWhitelist, InstalledApplicationsMakeASignature) {
  const struct {
    std::vector<std::string> installed;
    const char* version;
    std::string_view signature;
  } rows[] = {
      {{"1", "3"}, "0a1b", "5eL6fgobAAGaD9qqUA=="},
      {{"3", "1", "1", "unlisted"}, "0a1b", "5eL6fgobAAGaD9qqUA=="},
      {{"8"}, "0a1b", "kuhRoQobAAFP1Z9xAA=="},  // the highest number divides by 8: its bit is dropped
      {{"0"}, "0a1b", "w7emwQobAADs+EJ+"},
      {{"1", "3"}, "ff8a1B", "5eL6fgobAAGaD9qqUA=="},  // seven bits of the last byte but one
      {{"1", "3"}, "1b", "cMxw4AAbAAGaD9qqUA=="},
      {{"1000"}, "0a1b", "gGSwrIobAH0umu56AAT////nAA=="},
      {numbers(0, 39), "0001", "0PqaZ4ABAAURVKpoAAEngA=="},
      {numbers(0, 99), "0001", "r+pBfIABAA1UcS+pAAJjA4A="},
      {{"7", "8000"}, "1234", "UCUCkZI0A+hWzc46ACIGAP////////////////////////////////////////83QAAAAAA="},
      {{"1"}, "abc", kNone},
      {{"1"}, "", kNone},
      {{"1"}, "0g1b", kNone},
      {{"1"}, "+a1b", kNone},
      {{"unlisted"}, "0a1b", kNone},
      {{}, "0a1b", kNone},
  };
  std::vector<std::string> listed = numbers(0, 100);
  listed.insert(listed.end(), {"1000", "8000"});
  for (const auto& row : rows) {
    EXPECT_EQ(signatureOf(whitelist(listed, row.version), row.installed), row.signature)
        << row.version << fmt::format(", first of {}", row.installed.size());
  }
}

TEST(AppWhitelist, ANumberIsBoundedByTheSixteenBitsOfTheLength) {
  const std::vector<std::string> accepted{"524280", "524279", "3.0"};
  const std::string list = whitelist(accepted);
  EXPECT_EQ(signatureOf(list, {"524280"}).substr(0, 24), "L517o4ob//+qLq0LCAD/////");
  EXPECT_EQ(signatureOf(list, {"524280", "524279"}).substr(0, 24), "Z180Qoob//9TgcS9CAH/////");
  EXPECT_EQ(signatureOf(list, {"3.0"}), "iPMT1wobAAGpG9apEA==");
  for (const char* number : {"524281", "1099511627776", "18446744073709551615", "1e300", "-1", "2.5"}) {
    EXPECT_EQ(signatureOf(whitelist({number, "1"}), {number, "1"}), kNone) << number;
    EXPECT_NE(signatureOf(whitelist({number, "1"}), {"1"}), kNone) << number << " is not installed";
  }
}

TEST(AppWhitelist, OnlyAnIdentifierWithAVersionAndANumberCounts) {
  platform::simulated::SimulatedPlatform device;
  device.applicationRegistry().change({{"", "1.0"}, {"1", ""}, {"3", "1.0"}});
  const auto signature = processWhitelist(whitelist({"1", "3"}), device.applicationRegistry());
  ASSERT_NE(signature, std::nullopt);
  EXPECT_EQ(signature->text, "iPMT1wobAAGpG9apEA==");
  EXPECT_EQ(signature->applications, std::vector<std::string>{"3"});

  const auto listOf = [](const char* entries) {
    const std::string inner = fmt::format(R"({{"version":"0a1b","apps":{{{}}}}})", entries);
    return json{{"apps", inner}, {"compression", "RLE"}, {"encoding", "bitmap"}, {"more", 1}}.dump();
  };
  const std::string three = signatureOf(whitelist({"3"}), {"3"});
  for (const char* entries : {
           R"("a":{"encoding_id":1},"b":[{"encoding_id":3}])",
           R"("a":[{"encoding_id":1},{"id":1}],"b":[{"encoding_id":1},{"encoding_id":3}])",
           R"("a":[{"encoding_id":1},[]],"b":[null,{"encoding_id":3}])",
           R"("a":[{"encoding_id":"1"}],"b":[{"encoding_id":3}])",
           R"("a":[],"b":[{"encoding_id":1}],"b":[{"encoding_id":3}])",
           R"("a":[{"encoding_id":1}],"a":null,"b":[{"encoding_id":3}])",
       }) {
    EXPECT_EQ(signatureOf(listOf(entries), {"a", "b"}), three) << entries;
  }
}

TEST(AppWhitelist, AMalformedListMakesNone) {
  const std::string inner = R"({"version":"0a1b","apps":{"1":[{"encoding_id":1}]}})";
  const auto listOf = [](json apps, json compression = "RLE", json encoding = "bitmap") {
    return json{{"apps", apps}, {"compression", compression}, {"encoding", encoding}}.dump();
  };
  ASSERT_NE(signatureOf(listOf(inner), {"1"}), kNone);
  for (const std::string& list : {
           std::string(),
           std::string("[]"),
           std::string("{}"),
           listOf(inner).substr(1),
           listOf(inner) + "x",
           listOf(json::parse(inner)),
           listOf(nullptr),
           listOf(inner, "LZ"),
           listOf(inner, nullptr),
           listOf(inner, "RLE", "list"),
           listOf(inner + "]"),
           listOf(""),
           listOf("[1]"),
           listOf(R"({"version":"0a1b","apps":[]})"),
           listOf(R"({"version":2587,"apps":{"1":[{"encoding_id":1}]}})"),
           listOf(R"({"apps":{"1":[{"encoding_id":1}]}})"),
           listOf(R"({"version":"0a1b","apps":{"1":[{"encoding_id":1e999}]}})"),
           listOf(R"({"version":"0a1b","apps":{"1":)" + std::string(100000, '[')),
           listOf(inner, "RLE", "bitmap") + std::string(kMaximumWhitelistBytes, ' '),
       }) {
    EXPECT_EQ(signatureOf(list, {"1"}), kNone) << list.substr(0, 100);
  }
}

constexpr std::string_view kHeader = "X-Kestrel-Whitelisted-App-Signature";
constexpr const char* kOneAndThree = "5eL6fgobAAGaD9qqUA==";
constexpr const char* kThree = "iPMT1wobAAGpG9apEA==";

struct AppWhitelistControllerTest : testing::Test {
  VirtualDevice device;

  SimulatedApplicationRegistry& applications() { return device.platform.applicationRegistry(); }
  std::size_t generations() { return device.platform.transactions().openedCount("appWhitelist"); }
  std::optional<std::string> saved() {
    return device.platform.userDefaults().string("SBLAppWhitelistSignature");
  }
  std::vector<std::string> told() { return device.assembly().appWhitelistController->signedApplications(); }
  /// The service offers this list, and the device downloads it.
  void publish(const std::string& list) {
    device.service.on("/resources", answering(list));
    device.bag["download_resources_list"] = {"installed_app_whitelist"};
    device.bag["installed_app_whitelist"] =
        fmt::format("https://service.test/resources/apps?version={}", ++version_);
    device.publishBag();
    device.advance(70s);
  }
  /// The signature that a request of `Request` carries now.
  template <class Request = SBLSearchRequest>
  std::string sent(const char* path = "/search", std::string agent = "Beacon/1") {
    Request request;
    request.queryId = ++queryId_;
    if constexpr (requires { request.queryString; }) request.queryString = "q" + std::to_string(queryId_);
    if constexpr (requires { request.cardURL; }) request.cardURL = "https://service.test/card";
    device.service.forgetRequests();
    device.client("com.kestrel." + agent.substr(0, 4), agent).ask(request);
    const auto requests = device.service.requests(path);
    if (requests.size() != 1) return "no single request";
    const std::string* signature = requests.front().request.headers.find(kHeader);
    return signature == nullptr ? "" : *signature;
  }

 private:
  std::uint64_t queryId_ = 0;
  int version_ = 0;
};

TEST_F(AppWhitelistControllerTest, AListThatArrivesMakesASignatureForRequests) {
  applications().change({{"1", "1.0"}, {"3", "2.0"}});
  device.start();
  EXPECT_EQ(generations(), 1u) << "none was saved";
  EXPECT_EQ(applications().enumerations(), 0) << "without a list nobody asks what is installed";
  EXPECT_EQ(sent(), "");
  EXPECT_EQ(saved(), std::nullopt);

  publish(whitelist({"1", "3", "700"}));
  EXPECT_EQ(generations(), 2u);
  EXPECT_EQ(device.platform.transactions().openCount("appWhitelist"), 0u);
  EXPECT_EQ(saved(), kOneAndThree);
  EXPECT_EQ(told(), (std::vector<std::string>{"1", "3"}));
  EXPECT_EQ(device.platform.userDefaults().array("SBLAppWhitelistApplications"), (Dictionary{"1", "3"}));
  EXPECT_EQ(sent(), kOneAndThree);
  EXPECT_EQ(sent<SBLLookupRequest>(), kOneAndThree);
  EXPECT_EQ(sent<SBLCardRequest>("/card"), kOneAndThree);
  EXPECT_EQ(sent<SBLZeroKeywordRequest>(), "");
  EXPECT_EQ(sent("/search", "messages/1"), "") << "it tells nothing of where and what the device is";
  for (const char* line : {"generating app whitelist", "error reading app whitelist POSIXErrorDomain 2",
                           "installed app signature: 5eL6fgobAAGaD9qqUA=="}) {
    EXPECT_TRUE(device.log.contains(line)) << line;
  }

  device.assembly().notificationCenter.post(
      {kSBLFileDownloadCompletedNotification, nullptr, {{"identifier", std::string("lookup_hints_weekly")}}});
  device.run();
  EXPECT_EQ(generations(), 2u) << "another file";

  publish("[\"org.example.Mail\"]");
  EXPECT_EQ(saved(), std::nullopt);
  EXPECT_EQ(told(), std::vector<std::string>());
  EXPECT_EQ(sent(), "");
  EXPECT_EQ(device.log.count(platform::LogLevel::error, "Sable"), 1u) << "that there is no list yet is none";
}

TEST_F(AppWhitelistControllerTest, ABurstOfChangesIsTakenIn60SecondsAfterTheLast) {
  device.start();
  publish(whitelist({"1", "3"}));
  applications().change({{"3", "1.0"}});
  device.advance(61s);
  ASSERT_EQ(sent(), kThree);
  const std::size_t before = generations();
  for (int i = 0; i < 5; ++i) {
    applications().change({{"1", "1.0"}, {"3", "1.0"}});
    device.advance(40s);
    EXPECT_EQ(sent(), kThree);
  }
  device.advance(19s);
  EXPECT_EQ(sent(), kThree);
  EXPECT_EQ(generations(), before);
  device.advance(2s);
  EXPECT_EQ(sent(), kOneAndThree);
  device.advance(24h);
  EXPECT_EQ(generations(), before + 1);

  applications().change({});
  device.advance(61s);
  EXPECT_EQ(sent(), "");
  EXPECT_EQ(saved(), std::nullopt);
}

TEST_F(AppWhitelistControllerTest, ASavedSignatureSurvivesARestart) {
  applications().change({{"1", "1.0"}, {"3", "1.0"}});
  device.platform.userDefaults().set("SBLAppWhitelistSignature", kThree);
  device.start();
  EXPECT_EQ(generations(), 0u);
  EXPECT_EQ(sent(), kThree) << "until something changes";
  publish(whitelist({"1", "3"}));
  EXPECT_EQ(sent(), kOneAndThree);
}

TEST(RunLengthCode, ShorterRunsReplaceTheBitmap) {
  const struct {
    Bytes bitmap, body;
    bool compressed;
  } rows[] = {
      {{}, {}, false},
      {{0x50}, {0x50}, false},
      {Bytes(4), Bytes(4), false},           // as long as its runs
      {Bytes(5), {0, 1, 39, 0}, true},       // one shorter
      {Bytes(32), {0, 1, 255, 0}, true},     // 256 bits
      {Bytes(33), {0, 2, 255, 7, 0}, true},  // a run goes on in another
      {Bytes(64, 0xff), {0, 2, 255, 255, 0xc0}, true},
      {{0, 0, 0, 0, 0, 0x01, 0xff, 0xff}, {0, 2, 46, 16, 0x40}, true},
  };
  for (const auto& row : rows) {
    Bytes encoded;
    EXPECT_EQ(encodeRun(row.bitmap, encoded), row.compressed);
    EXPECT_EQ(encoded, row.body) << row.bitmap.size();
  }
  Bytes blob, expected{0x13, 0x29, 0xa7, 0x5e, 0, 32};  // the end of the MD5, then the number of runs
  EXPECT_TRUE(rle_compress(Bytes(1000), blob));
  expected.insert(expected.end(), 31, 255);
  expected.push_back(63);
  expected.insert(expected.end(), 4, 0);
  EXPECT_EQ(blob, expected);
}

/// What of a bitmap is left after its index was kept in eight bits.
Bytes wrapped(const Bytes& bitmap) {
  Bytes out(bitmap.size());
  for (std::size_t i = 0; i < bitmap.size(); ++i) out[i % 256] |= bitmap[i];
  return out;
}

TEST(RunLengthCode, ExpandingUndoesCompressing) {
  std::mt19937 random(1);
  for (int round = 0; round < 300; ++round) {
    Bytes bitmap(random() % (round % 10 == 0 ? 3000 : 257));
    const auto set = random() % 40;
    for (std::size_t i = 0; i < set && !bitmap.empty(); ++i) {
      const std::size_t from = random() % bitmap.size(), to = from + random() % (bitmap.size() - from);
      std::fill(bitmap.begin() + static_cast<std::ptrdiff_t>(from),
                bitmap.begin() + static_cast<std::ptrdiff_t>(to),
                static_cast<std::uint8_t>(i % 3 == 0 ? random() : 0xff));
    }
    Bytes blob;
    const bool compressed = rle_compress(bitmap, blob);
    EXPECT_LE(blob.size(), kBlobDigestBytes + bitmap.size());
    Bytes expanded(bitmap.size(), 0xaa);
    ASSERT_TRUE(rle_expand(blob, kBlobDigestBytes, blob.size() - kBlobDigestBytes, expanded, compressed));
    EXPECT_EQ(expanded, compressed ? wrapped(bitmap) : bitmap);
  }
}

TEST(RunLengthCode, LengthsThatContradictEachOtherAreRefused) {
  Bytes out(5);
  const Bytes blob{9, 9, 9, 9, 0, 1, 39, 0x80};
  ASSERT_TRUE(rle_expand(blob, 4, 4, out, true));
  EXPECT_EQ(out, Bytes(5, 0xff));
  for (const std::size_t length : {0, 1, 2, 3, 5})
    EXPECT_FALSE(rle_expand(blob, 4, length, out, true)) << length;
  EXPECT_FALSE(rle_expand(blob, 9, 0, out, true));
  EXPECT_FALSE(rle_expand(blob, SIZE_MAX, 4, out, true));
  EXPECT_FALSE(rle_expand(blob, 4, 4, std::span(out).first(4), true)) << "more bits than there is room for";
  EXPECT_FALSE(rle_expand(blob, 4, 4, out, false)) << "fewer bytes than asked for";
  EXPECT_TRUE(rle_expand(blob, 4, 4, std::span(out).first(4), false));
  EXPECT_FALSE(rle_expand(Bytes(3), 0, 0, {}, false));
}

}  // namespace
}  // namespace sable::test

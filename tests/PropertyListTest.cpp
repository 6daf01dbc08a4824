#include <gtest/gtest.h>

#include <limits>
#include <nlohmann/json.hpp>
#include <random>

#include "platform/PropertyList.h"

namespace sable::platform {
namespace {

std::string bigEndian(std::uint64_t value, int bytes) {
  std::string text;
  for (int i = bytes - 1; i >= 0; --i) text += static_cast<char>(value >> 8 * i & 0xFF);
  return text;
}

/// A file of these objects, the first of which is the root; references take 4 bytes.
std::string propertyList(const std::vector<std::string>& objects) {
  std::string text = "bplist00", offsets;
  for (const std::string& object : objects) {
    offsets += bigEndian(text.size(), 4);
    text += object;
  }
  const std::size_t table = text.size();
  return text + offsets + std::string(6, '\0') + "\x04\x04" + bigEndian(objects.size(), 8) + bigEndian(0, 8) +
         bigEndian(table, 8);
}

std::string reference(std::uint64_t object) {
  return bigEndian(object, 4);
}

Dictionary json(std::string_view text) {
  return *parseJSON(text, 1u << 20);
}

TEST(PropertyListTest, WhatIsWrittenReadsTheSame) {
  for (const std::string_view text : {
           R"({"version":"12","enabled":true,"z":false,"a":[1,-5,0.1,"",{"é":"naïve 😀"},[],{}]})",
           R"([9223372036854775807,-9223372036854775808,0,255,256,65536,4294967296,-1])",
           R"([9223372036854775808,18446744073709551615])",
           R"({"a\u0000b":"c\u0000d"})",
           R"([1.5,-0.0,1e300,17.299999999999997])",
           R"(["the same","the same",{"k":"the same"}])",
           R"("a string alone that is longer than fifteen characters")",
           R"({"z":1,"y":2,"x":3,"a":4})",
       }) {
    const auto bytes = encodePropertyList(json(text));
    ASSERT_TRUE(bytes) << text << bytes.error().reason;
    const auto value = decodePropertyList(*bytes);
    ASSERT_TRUE(value) << text << value.error().reason;
    EXPECT_EQ(compactJSON(*value), compactJSON(json(text)));
  }
}

TEST(PropertyListTest, WhatHasNoCounterpartIsLeftOutOrRefused) {
  EXPECT_EQ(*decodePropertyList(*encodePropertyList(json(R"({"a":null,"b":[null,1]})"))),
            json(R"({"b":[1]})"));
  Dictionary deep = 1;
  for (int i = 0; i < kMaximumJSONDepth; ++i) deep = Dictionary::array({std::move(deep)});
  EXPECT_EQ(*decodePropertyList(*encodePropertyList(deep)), deep);
  deep = Dictionary::array({std::move(deep)});
  for (const Dictionary& value : {json("null"), Dictionary("\xff"), Dictionary({{"\xff", 1}}), deep}) {
    const auto refused = encodePropertyList(value);
    ASSERT_FALSE(refused);
    EXPECT_EQ(refused.error().code, static_cast<std::int64_t>(PropertyListErrorCode::notEncodable));
  }
}

TEST(PropertyListTest, WritesTheShortestFormOfEachAndEqualStringsOnce) {
  EXPECT_EQ(*encodePropertyList(json(R"([255,256,"é","x","x",true])")),
            propertyList({}).substr(0, 8) + "\xA6\x01\x02\x03\x04\x04\x05" + "\x10\xFF" +
                std::string("\x11\x01\x00", 3) + std::string("\x61\x00\xE9", 3) + "\x51x" + "\x09" +
                "\x08\x0F\x11\x14\x17\x19" + std::string(6, '\0') + "\x01\x01" + bigEndian(6, 8) +
                bigEndian(0, 8) + bigEndian(26, 8));
  const Dictionary large(std::string(kMaximumPropertyListBytes, 'x'));
  EXPECT_EQ(encodePropertyList(large).error().code,
            static_cast<std::int64_t>(PropertyListErrorCode::tooLarge));
}

TEST(PropertyListTest, ReadsWhatOtherWritersWrite) {
  const auto decoded = [](const std::vector<std::string>& objects) {
    const auto value = decodePropertyList(propertyList(objects));
    return value ? compactJSON(*value) : value.error().description();
  };
  EXPECT_EQ(decoded({"\x14" + bigEndian(0, 8) + bigEndian(~0ull, 8)}), "18446744073709551615");
  EXPECT_EQ(decoded({"\x13" + bigEndian(~0ull, 8)}), "-1");
  EXPECT_EQ(decoded({"\x10\xFF"}), "255");
  EXPECT_EQ(decoded({"\x33" + bigEndian(0x4000000000000000, 8)}), "978307202.0");
  EXPECT_EQ(decoded({"\x22" + bigEndian(0x3FC00000, 4)}), "1.5");
  EXPECT_EQ(decoded({std::string("\x41") + "a"}), R"("YQ==")");
  EXPECT_EQ(decoded({std::string("\x42") + "ab"}), R"("YWI=")");
  EXPECT_EQ(decoded({std::string("\x44") + "abcd"}), R"("YWJjZA==")");
  EXPECT_EQ(decoded({"\x80\x07"}), "7");
  EXPECT_EQ(decoded({"\xA2" + reference(1) + reference(1), "\x10\x05"}), "[5,5]");
  EXPECT_EQ(decoded({std::string("\x6F\x10\x02\xD8\x3D\xDE\x00", 7)}), R"("😀")");
}

TEST(PropertyListTest, HostileFilesAreRefused) {
  std::vector<std::string> chain, doubling;
  for (std::uint64_t i = 0; i < 100'000; ++i) chain.push_back("\xA1" + reference(i + 1));
  chain.emplace_back("\x09");
  for (std::uint64_t i = 0; i < 40; ++i) doubling.push_back("\xA2" + reference(i + 1) + reference(i + 1));
  doubling.emplace_back("\x09");

  const std::string cases[] = {
      "",
      "bplist00",
      "bplist00" + std::string(32, '\xff'),
      "bplist00" + std::string(32, '\0'),
      propertyList({"\xA1" + reference(0)}),
      propertyList({"\xA1" + reference(7)}),
      propertyList({"\xD1" + reference(0) + reference(0)}),
      propertyList({"\xD2" + reference(1) + reference(1) + reference(1) + reference(1), "\x51k"}),
      propertyList({"\x5F\x13\xFF\xFF\xFF\xFF\xFF\xFF\xFF\xFF"}),
      propertyList({"\xAF\x13\xFF\xFF\xFF\xFF\xFF\xFF\xFF\xFF"}),
      propertyList({std::string("\x61\xD8\x00", 3)}),
      propertyList({std::string("\x61\xDC\x00", 3)}),
      propertyList({"\x51\xE9"}),
      propertyList({"\x17"}),
      propertyList({"\x14" + bigEndian(1, 8) + bigEndian(0, 8)}),
      propertyList({"\x70"}),
      propertyList(chain),
      propertyList(doubling),
      std::string(kMaximumPropertyListBytes + 1, 'x'),
  };
  for (const std::string& bytes : cases) {
    const auto value = decodePropertyList(bytes);
    ASSERT_FALSE(value) << bytes.substr(0, 60);
    EXPECT_EQ(value.error().domain, kPropertyListErrorDomain);
  }
}

TEST(PropertyListTest, DamagedFilesNeverDoHarm) {
  const std::string whole = *encodePropertyList(
      json(R"({"a":[1,2.5,"text",{"é":"naïve"}],"b":true,"long":"0123456789abcdefghij"})"));
  for (std::size_t length = 0; length < whole.size(); ++length) {
    EXPECT_FALSE(decodePropertyList(std::string_view(whole).substr(0, length)));
  }
  std::mt19937 random(1);
  for (int round = 0; round < 20'000; ++round) {
    std::string bytes = whole;
    for (int i = 0; i < 3; ++i) bytes[random() % bytes.size()] = static_cast<char>(random());
    const auto value = decodePropertyList(bytes);
    EXPECT_TRUE(value ? !compactJSON(*value).empty() : value.error().domain == kPropertyListErrorDomain);
  }
}

}  // namespace
}  // namespace sable::platform

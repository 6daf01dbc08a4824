#include <gtest/gtest.h>

#include <nlohmann/json.hpp>

#include "platform/Dictionary.h"

namespace sable {
namespace {

constexpr std::size_t kLimit = 64u << 20;

TEST(DictionaryTest, TextSurvivesAsItIs) {
  for (const std::string text : {
           R"({"z":1,"a":{"y":[1,2.0,true,null],"b":"\u0001é😀"}})",
           R"([18446744073709551615,-9223372036854775808,9007199254740993])",
           R"([0.1,1e-07,17.299999999999997,-0.0,1.7976931348623157e+308])",
           R"("")",
           R"(null)",
       }) {
    const auto value = parseJSON(text, kLimit);
    ASSERT_TRUE(value) << text << ": " << value.error().reason;
    EXPECT_EQ(compactJSON(*value), text);
  }
}

TEST(DictionaryTest, OfMembersWithOneNameTheLastValueCountsInTheFirstPlace) {
  EXPECT_EQ(compactJSON(*parseJSON(R"({"a":1,"b":2,"a":3,"c":4,"b":{"x":1,"x":2},"a":5})", kLimit)),
            R"({"a":5,"b":{"x":2},"c":4})");
}

TEST(DictionaryTest, ARefusalNamesWhatAndWhere) {
  struct Case {
    std::string text;
    JSONErrorCode code;
    std::string_view where;
  };
  const std::string deepest = std::string(512, '[') + std::string(512, ']');
  ASSERT_TRUE(parseJSON(deepest, kLimit));
  const Case cases[] = {
      {"", JSONErrorCode::malformed, "byte 0: "},
      {"{\"a\" 1}", JSONErrorCode::malformed, "byte 5: "},
      {"[1e400]", JSONErrorCode::malformed, "byte 5: "},
      {"[01]", JSONErrorCode::malformed, "byte 2: "},
      {"[1] 2", JSONErrorCode::malformed, "byte 4: "},
      {"[NaN]", JSONErrorCode::malformed, "byte 1: "},
      {"\"\xff\"", JSONErrorCode::malformed, "byte 1: "},
      {"\"\xc0\xaf\"", JSONErrorCode::malformed, "byte 1: "},
      {R"("\ud800")", JSONErrorCode::malformed, "byte 7: "},
      {"\"[[[\\\"[", JSONErrorCode::malformed, "byte 7: "},
      {"[" + deepest + "]", JSONErrorCode::tooDeep, "byte 512: "},
      {std::string(2'000'000, '['), JSONErrorCode::tooDeep, "byte 512: "},
  };
  for (const Case& each : cases) {
    const auto value = parseJSON(each.text, kLimit);
    ASSERT_FALSE(value) << each.text;
    EXPECT_EQ(value.error().domain, kJSONErrorDomain);
    EXPECT_EQ(value.error().code, static_cast<std::int64_t>(each.code)) << each.text;
    EXPECT_TRUE(value.error().reason.starts_with(each.where)) << each.text << ": " << value.error().reason;
    EXPECT_EQ(value.error().reason.find('\xff'), std::string::npos);
  }
}

TEST(DictionaryTest, TheLengthIsBoundToTheByte) {
  EXPECT_TRUE(parseJSON("[1]", 3));
  const auto refused = parseJSON("[1 ]", 3);
  ASSERT_FALSE(refused);
  EXPECT_EQ(refused.error().code, static_cast<std::int64_t>(JSONErrorCode::tooLong));
}

TEST(DictionaryTest, BytesThatAreNotTextLeaveAsReplacementCharacters) {
  EXPECT_EQ(compactJSON(Dictionary("a\xff"
                                   "b")),
            "\"a\xef\xbf\xbd"
            "b\"");
}

TEST(DictionaryTest, AMemberOfAnotherTypeCountsAsAbsent) {
  const Dictionary object = *parseJSON(
      R"({"s":"x","n":1.5,"i":-7,"u":18446744073709551615,"b":false,"a":["p","q"],"m":["p",1],"0":null})",
      kLimit);
  EXPECT_EQ(stringMember(object, "s"), "x");
  EXPECT_EQ(numberMember(object, "n"), 1.5);
  EXPECT_EQ(numberMember(object, "i"), -7.0);
  EXPECT_EQ(integerMember(object, "i"), -7);
  EXPECT_EQ(numberMember(object, "u"), 18446744073709551615.0);
  EXPECT_EQ(booleanMember(object, "b"), false);
  EXPECT_EQ(stringsMember(object, "a"), (std::vector<std::string>{"p", "q"}));

  for (const std::string_view key : {"n", "b", "a", "0", "missing"})
    EXPECT_FALSE(stringMember(object, key)) << key;
  for (const std::string_view key : {"s", "n", "u", "b", "0"})
    EXPECT_FALSE(integerMember(object, key)) << key;
  for (const std::string_view key : {"s", "b", "a", "0"}) EXPECT_FALSE(numberMember(object, key)) << key;
  for (const std::string_view key : {"s", "i", "0"}) EXPECT_FALSE(booleanMember(object, key)) << key;
  for (const std::string_view key : {"s", "m", "0"}) EXPECT_FALSE(stringsMember(object, key)) << key;
  EXPECT_FALSE(stringMember(Dictionary("no object"), "s"));
}

TEST(ErrorTest, ASystemErrorSaysWhatWasTried) {
  const Error error = posixError(2, "/some/file");
  EXPECT_EQ(error, (Error{"POSIXErrorDomain", 2, "/some/file: No such file or directory"}));
  EXPECT_EQ(error.description(), "POSIXErrorDomain 2: /some/file: No such file or directory");
}

}  // namespace
}  // namespace sable

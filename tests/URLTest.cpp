#include <gtest/gtest.h>

#include "platform/URL.h"

namespace sable::platform {
namespace {

using Items = std::vector<URLQueryItem>;

TEST(URL, OnlyAbsoluteURLsWithAHostAreRead) {
  const std::string_view good[] = {
      "http://h",         "https://h:8443/p?a=b#f", "http://u:p@h/", "ftp://h/x",          "x-y+z.1://h/",
      "http://[::1]:80/", "http://h/?a=%zz",        "http://h/%00",  "http://h/a/../b/./", "http://h?x"};
  for (const auto text : good) {
    const auto url = URL::parse(text);
    ASSERT_TRUE(url) << text;
    EXPECT_EQ(url->string(), text);
  }

  using namespace std::string_view_literals;
  const std::string_view bad[] = {"",
                                  "h",
                                  "/p",
                                  "//h/p",
                                  ":",
                                  "://h",
                                  "1x://h/",
                                  "http:",
                                  "http:h",
                                  "http:/h",
                                  "http://",
                                  "http:///h",
                                  "http://:80/",
                                  "http://?q",
                                  "http://#f",
                                  "http://u@/",
                                  "mailto:a@h",
                                  "file:///etc/passwd",
                                  "http://h:99999/",
                                  "http://h:p/",
                                  "http://[::1/",
                                  "http://a b/",
                                  "http://h/a b",
                                  "http://h/?a b",
                                  "http://h\\x/",
                                  "http://h/\r\nX: 1",
                                  "http://h/\x7f",
                                  "http://h/\0x"sv,
                                  "http://h%00/"};
  for (const auto text : bad) EXPECT_FALSE(URL::parse(text)) << text;
}

TEST(URL, SchemeAndHostAreLowerCase) {
  const auto url = URL::parse("HTTPS://Search.Example.ORG:8443/Path");
  EXPECT_EQ(url->scheme(), "https");
  EXPECT_EQ(url->host(), "search.example.org");
  EXPECT_EQ(URL::parse("http://[2001:DB8::1]:80/")->host(), "2001:db8::1");
}

TEST(URL, ReferencesAreResolved) {
  const struct {
    const char *reference, *target;  // null: none
  } cases[] = {
      {"http://other/x", "http://other/x"},
      {"//other/x", "https://other/x"},
      {"/x?y", "https://h:81/x?y"},
      {"x", "https://h:81/a/x"},
      {"../x", "https://h:81/x"},
      {"?y", "https://h:81/a/b?y"},
      {"", "https://h:81/a/b?q"},
      {"ftp://h/", "ftp://h/"},
      {"file:///etc", nullptr},
      {"http://[::", nullptr},
      {"a b", "https://h:81/a/a%20b"},
      {"\x01", nullptr},
  };
  const auto base = URL::parse("https://h:81/a/b?q");
  for (const auto& [reference, target] : cases) {
    const auto resolved = base->resolve(reference);
    EXPECT_EQ(resolved ? resolved->string() : "", target == nullptr ? "" : target) << reference;
  }
}

TEST(URL, QueryItemsAreDecodedInOrder) {
  const struct {
    std::string_view query;
    Items items;
  } rows[] = {
      {"", {}},
      {"?", {}},
      {"?a", {{"a", std::nullopt}}},
      {"?a=", {{"a", ""}}},
      {"?=v", {{"", "v"}}},
      {"?b=1&a=2&b=3", {{"b", "1"}, {"a", "2"}, {"b", "3"}}},
      {"?q=1+1=2", {{"q", "1+1=2"}}},
      {"?q=%2B%26%3d%20", {{"q", "+&= "}}},
      {"?q=%c3%A9", {{"q", "\xc3\xa9"}}},
      {"?q=100%&r=%4&s=%g1%41", {{"q", "100%"}, {"r", "%4"}, {"s", "%g1A"}}},
      {"?&&a=1&", {{"a", "1"}}},
      {"?a=1#b=2", {{"a", "1"}}},
      {"#?a=1", {}},
  };
  for (const auto& row : rows) {
    const auto url = URL::parse("http://h/p" + std::string(row.query));
    ASSERT_TRUE(url) << row.query;
    EXPECT_EQ(url->queryItems(), row.items) << row.query;
  }
}

TEST(URL, ValuesArriveAsTheyWereSet) {
  auto url = *URL::parse("http://H:81/a/../%7Eb;c?old=1#part");
  const Items items{{"q", "a+b;c&d=e f/\xc3\xa9%"}, {"a b", ""}, {"flag", std::nullopt}, {"-._~", "-._~"}};
  url.setQueryItems(items);
  EXPECT_EQ(url.string(),
            "http://H:81/a/../%7Eb;c?q=a%2Bb%3Bc%26d%3De%20f%2F%C3%A9%25&a%20b=&flag&-._~=-._~#part");
  EXPECT_EQ(url.queryItems(), items);

  url.setQueryItems({});
  EXPECT_EQ(url.string(), "http://H:81/a/../%7Eb;c#part");
}

}  // namespace
}  // namespace sable::platform

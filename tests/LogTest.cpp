#include <fmt/format.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <functional>
#include <stdexcept>
#include <string>
#include <vector>

#include "platform/Log.h"
#include "platform/host/HostLog.h"
#include "platform/simulated/SimulatedLog.h"

namespace {

struct Unprintable {};

}  // namespace

template <>
struct fmt::formatter<Unprintable> : fmt::formatter<std::string_view> {
  template <class Context>
  auto format(const Unprintable&, Context& context) const -> decltype(context.out()) {
    throw std::runtime_error("no words for it");
  }
};

namespace sable::platform {
namespace {

constexpr LogHandle bag("com.kestrel.sabled", "Sable_Bag");

std::string onStandardError(LogLevel minimum, std::vector<std::string> categories,
                            const std::function<void()>& log) {
  host::HostLog sink(minimum, std::move(categories));
  installLogSink(&sink);
  testing::internal::CaptureStderr();
  log();
  installLogSink(nullptr);
  return testing::internal::GetCapturedStderr();
}

TEST(LogTest, ALineHasTimeLevelCategoryAndMessage) {
  const std::string text = onStandardError(LogLevel::debug, {}, [] {
    bag.standard("fetched {} of {}", 3, "4");
    LogHandle("com.kestrel.sabled", "").error("plain");
  });
  const std::string time = "[0-9]{4}-[0-9]{2}-[0-9]{2}T[0-9]{2}:[0-9]{2}:[0-9]{2}\\.[0-9]{3}Z ";
  EXPECT_THAT(text, testing::MatchesRegex(time + "default Sable_Bag: fetched 3 of 4\n" + time +
                                          "error default: plain\n"));
}

TEST(LogTest, ThresholdAndCategoriesDecideWhatShows) {
  const std::string text = onStandardError(LogLevel::info, {"Sable_Bag", "default"}, [] {
    bag.debug("too low");
    bag.info("shown");
    platformLog().fault("other category");
    LogHandle("com.kestrel.sabled", "").info("default shown");
  });
  EXPECT_NE(text.find("shown"), std::string::npos);
  EXPECT_NE(text.find("default shown"), std::string::npos);
  EXPECT_EQ(text.find("too low"), std::string::npos);
  EXPECT_EQ(text.find("other category"), std::string::npos);
}

TEST(LogTest, HostileTextCannotForgeALineOrDriveATerminal) {
  const struct {
    const char* text;
    const char* shown;
  } rows[] = {
      {"a\n2026 error x: y", "a\\n2026 error x: y"},
      {"\x1b[2J\r", "\\u{1b}[2J\\u{d}"},
      {"\xc2\x9b"
       "31m",
       "\\u{9b}31m"},
      {"\x9b"
       "31m\xff",
       "\\x9b31m\\xff"},
      {"\xe2\x80\xae"
       "evil\xe2\x80\xa8",
       "\\u{202e}evil\\u{2028}"},
      {"caf\xc3\xa9 \xf0\x9f\x90\xa6 100% {}", "caf\xc3\xa9 \xf0\x9f\x90\xa6 100% {}"},
      {"cut \xe2\x80", "cut \\xe2\\x80"},
  };
  for (const auto& row : rows) {
    const std::string line = onStandardError(LogLevel::debug, {}, [&] { bag.info("{}", row.text); });
    EXPECT_TRUE(line.ends_with(std::string("info  Sable_Bag: ") + row.shown + "\n")) << line;
  }
}

TEST(LogTest, ALineThatCannotBeFormattedSaysSo) {
  const simulated::SimulatedLog log;
  EXPECT_NO_THROW(bag.error("value {}", Unprintable{}));
  EXPECT_TRUE(log.contains("value  [not formatted: no words for it]"));
  EXPECT_EQ(log.count(LogLevel::error, "Sable_Bag"), 1U);
  EXPECT_EQ(log.count(LogLevel::error, "Platform"), 0U);
}

}  // namespace
}  // namespace sable::platform

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/WordTokenizer.h"
#include "sabled/DownloadManager.h"
#include "sabled/Lookup.h"
#include "tests/support/VirtualDevice.h"

// Lookups of selected text on the virtual device.
namespace sable::test {
namespace {

struct LookupTest : testing::Test {
  VirtualDevice device;
};

TEST_F(LookupTest, TheSignatureIsTakenFromTheThirdFourthAndSecondPieceOfThePath) {
  struct Row {
    const char *url, *signature;
  };
  for (const Row& row : {
           Row{"https://h.test/a/b/c/d", "c-d-b"},
           Row{"https://h.test/a/b/c/d/e?x=/1/2#/3", "c-d-b"},
           Row{"https://h.test/a/b/c/", "c--b"},
           Row{"https://h.test/a/b/c", ""},
           Row{"https://h.test/a/b/c?/d/e", ""},
           Row{"https://h.test", ""},
           Row{"/a/b/c/d", ""},
           Row{"", ""},
       }) {
    const auto before = device.log.count("invalid lookup hints url when processing signature: ");
    EXPECT_EQ(Lookup::signatureFromURL(row.url), row.signature) << row.url;
    const auto logged = device.log.count("invalid lookup hints url when processing signature: ") - before;
    EXPECT_EQ(logged, *row.signature == '\0' ? 1u : 0u) << row.url;
  }
}

// Filtering

/// Instructions that every context fits, with some of them replaced.
json instructions(json changes) {
  json all{{"keywords", json::array()},
           {"min_keywords_score", 0},
           {"completion", ""},
           {"min_subject_score", 0},
           {"subject", ""}};
  if (changes.is_object()) all.update(changes);
  return all;
}

struct LookupFilter : LookupTest {
  void filter(std::optional<std::string> context, json& response) {
    SBLLookupRequest request;
    request.queryId = 7;
    request.queryString = "selected";
    request.queryContext = std::move(context);
    Lookup::filterLookupResultsWithRequest(request, response, device.platform);
  }
  bool keeps(std::string context, json changes) {
    json response = {{{"results", {{{"id", 1}, {"lookup_instructions", instructions(std::move(changes))}}}}}};
    filter(std::move(context), response);
    return !response[0]["results"].empty();
  }
  void speak(std::string locale) { device.platform.localeInfo().values.localeIdentifier = std::move(locale); }
};

TEST_F(LookupFilter, AResultFitsWhereItsKeywordsCompletionAndSubjectDo) {
  const auto words = [](std::initializer_list<std::pair<const char*, double>> list) {
    json keywords = json::array();
    for (const auto& [word, weight] : list) keywords.push_back({{"word", word}, {"weight", weight}});
    return keywords;
  };
  const struct {
    const char* context;
    json changes;
    bool kept;
  } rows[] = {
      {"a text", {}, true},
      // Keywords
      {"we Start here", {{"keywords", words({{"art", 1}})}, {"min_keywords_score", 1}}, true},
      {"we Start here", {{"keywords", words({{"arts", 1}})}, {"min_keywords_score", 1}}, false},
      {"one", {{"keywords", words({{"one", 0.7}})}, {"min_keywords_score", 0.7}}, true},
      {"one", {{"keywords", words({{"one", 0.7}})}, {"min_keywords_score", 0.70001}}, false},
      {"one two",
       {{"keywords", words({{"one", 0.5}, {"two", 0.25}, {"ten", 9}})}, {"min_keywords_score", 0.75}},
       true},
      {"one", {{"keywords", words({{"one", 5}, {"one", 1}})}, {"min_keywords_score", 2}}, false},
      {"one", {{"keywords", words({{"one", 1}, {"one", 5}})}, {"min_keywords_score", 2}}, true},
      {"one two", {{"keywords", words({{"one", 3}, {"two", -2}})}, {"min_keywords_score", 2}}, false},
      {"", {{"keywords", words({{"one", 1}})}, {"min_keywords_score", 0.1}}, false},
      {"", {{"keywords", words({{"one", 1}})}, {"min_keywords_score", -0.1}}, true},
      // Completion
      {"we Start here", {{"completion", "START H"}}, true},
      {"we Start here", {{"completion", "start there"}}, false},
      {"one", {{"keywords", words({{"one", 9}})}, {"completion", "two"}}, false},
      {"", {{"completion", "x"}}, false},
      // Subject
      {"new york city", {{"subject", "New York"}, {"min_subject_score", 0.6}}, true},
      {"new york city", {{"subject", "New York"}, {"min_subject_score", 0.7}}, false},
      {"city York, NEW new", {{"subject", "york: New! new?"}, {"min_subject_score", 0.6}}, true},
      {"one two", {{"subject", "two one"}, {"min_subject_score", 1}}, true},
      {"one two three", {{"subject", "one five"}, {"min_subject_score", 0.25}}, true},
      {"one", {{"subject", ""}, {"min_subject_score", 0.0001}}, false},
      {"one", {{"subject", "..."}, {"min_subject_score", 0.0001}}, false},
      {"", {{"subject", "one"}, {"min_subject_score", 0.0001}}, false},
      {"one", {{"subject", "two"}, {"min_subject_score", -1}}, true},
      // Members that are missing or of another type ask for nothing
      {"one", {{"keywords", 5}, {"completion", nullptr}, {"min_subject_score", "1"}}, true},
      {"one",
       {{"keywords", {5, {{"word", 5}, {"weight", 9}}, {{"word", "one"}}}}, {"min_keywords_score", 1}},
       false},
  };
  for (const auto& row : rows)
    EXPECT_EQ(keeps(row.context, row.changes), row.kept) << row.context << row.changes;
}

TEST_F(LookupFilter, WhatIsDroppedIsToldOfWithItsScores) {
  keeps("one", {{"min_keywords_score", 0.5}});
  keeps("one", {{"completion", "two"}});
  keeps("one two", {{"subject", "one"}, {"min_subject_score", 0.75}});
  EXPECT_TRUE(
      device.log.contains("dropping lookup result. keyword score: 0.000000 min keyword score: 0.500000 "
                          "completion exists: 1"));
  EXPECT_TRUE(device.log.contains("min keyword score: 0.000000 completion exists: 0"));
  EXPECT_TRUE(
      device.log.contains("dropping lookup result. jaccard index: 0.500000 min subject score: 0.750000"));
  EXPECT_EQ(device.log.count("dropping lookup result"), 3u);
}

TEST_F(LookupFilter, TheRestOfTheResponseStaysAsItIsAndInOrder) {
  const json bad = instructions({{"completion", "absent"}}), good = instructions({});
  const auto result = [](int id, const json& instructions) {
    return json{{"id", id}, {"lookup_instructions", instructions}};
  };
  json response = {{{"query", "q"},
                    {"results", {{{"id", 1}}, result(2, bad), result(3, good), "text", result(4, nullptr)}},
                    {"x", 1}},
                   {{"results", {result(5, bad)}}},
                   {{"results", "none"}},
                   5,
                   json::object()};
  filter(std::nullopt, response);
  EXPECT_EQ(response,
            json::parse(R"([{"query":"q","results":[{"id":1},{"id":3,"lookup_instructions":)" + good.dump() +
                        R"(},"text",{"id":4,"lookup_instructions":null}],"x":1},
      {"results":[]}, {"results":[]}, 5, {"results":[]}])"));
}

TEST_F(LookupFilter, AnythingButAnArrayOfItemsIsLeftAlone) {
  json object = {{"results", {{{"lookup_instructions", instructions({{"completion", "x"}})}}}}};
  const json before = object;
  filter("one", object);
  EXPECT_EQ(object, before);
  EXPECT_TRUE(
      device.log.contains("lookup response is not an array. who knows what this is: " + before.dump()));
  EXPECT_EQ(device.log.count(platform::LogLevel::error), 1u);
  json empty = json::array();
  filter("private words", empty);
  EXPECT_TRUE(device.log.contains(
      "no data to process for lookup response. request: SBLLookupRequest 7 response: []"));
  EXPECT_FALSE(device.log.contains("private"));
}

TEST_F(LookupFilter, LetterCaseFollowsTheLocale) {
  const struct {
    const char *locale, *context, *part;
    bool contained;
  } rows[] = {
      {"en_US", "ISPARTA", "isparta", true},
      {"tr_TR", "ISPARTA", "isparta", false},
      {"tr_TR", "ISPARTA", "ısparta", true},
      {"en_US", "ISPARTA", "ısparta", false},
      {"tr", "İstanbul'da", "istanbul", true},
      {"en_US", "İstanbul'da", "istanbul", false},
      {"az_Latn_AZ", "I\u0307zmir", "izmir", true},
      {"de_DE", "GROSSE STRASSE", "straße", true},
      {"de_DE", "Große Straße", "STRASSE", true},
      {"de_DE", "Größe", "grosse", false},
      {"el_GR", "ΟΔΟΣ", "οδος", true},
      {"en_US", "Cafe\u0301", "CAFÉ", true},
      {"en_US", "Cafe\u0301", "cafe", false},
      {"en_US", "café", "e", false},
      {"ja_JP", "ＡＲＴ と ﾃﾚﾋﾞ", "art", true},
      {"ja_JP", "ＡＲＴ と ﾃﾚﾋﾞ", "テレビ", true},
      {"hi_IN", "की", "क", false},
      {"en_US", "wave 👋🏽", "👋", false},
      {"en_US", "wave 👋🏽 👋", "👋", true},
      {"en_US", "bad \xFF byte", "byte", true},
  };
  for (const auto& row : rows) {
    speak(row.locale);
    EXPECT_EQ(keeps(row.context, {{"completion", row.part}}), row.contained)
        << row.locale << ' ' << row.context << ' ' << row.part;
  }
}

TEST_F(LookupFilter, WordsAreTheLanguagesOwn) {
  using testing::ElementsAre;
  const auto words = [&](const char* locale, const char* text) {
    speak(locale);
    return Lookup::tokenize(text, device.platform);
  };
  EXPECT_THAT(words("en_US", "New York, isn't 3.5 NEW?"), ElementsAre("new", "york", "isn't", "3.5", "new"));
  EXPECT_THAT(words("de_DE", "Die Größe der STRASSE, z.B. Straße"),
              ElementsAre("die", "größe", "der", "strasse", "z.b", "straße"));
  EXPECT_THAT(words("ja_JP", "日本語の本。"), ElementsAre("日本語", "の", "本"));
  EXPECT_THAT(words("th_TH", "สวัสดีชาวโลก"), ElementsAre("สวัสดี", "ชาว", "โลก"));
  EXPECT_THAT(words("en_US", "I ❤️ 🍕👨‍👩‍👧 Naples"), ElementsAre("i", "naples"));
  EXPECT_THAT(words("tr_TR", "IŞIK İZMİR"), ElementsAre("ışık", "izmir"));
  EXPECT_THAT(words("en_US", "IŞIK"), ElementsAre("işik"));
  EXPECT_THAT(words("el_GR", "ΟΔΟΣ"), ElementsAre("οδος"));
  EXPECT_THAT(words("en_US", "cafe\u0301 café"), ElementsAre("café", "café"))
      << "however the mark is encoded";
  EXPECT_THAT(words("no such locale", "one two"), ElementsAre("one", "two"));
  EXPECT_THAT(words("en_US", " \n…"), ElementsAre());
}

// Hint files

struct LookupHints : LookupTest {
  static constexpr const char* kWeekly = "https://files.test/hints/weekly";
  static constexpr const char* kWeeklyFile = "/home/user/.cache/com.kestrel.sabled/lookup_hints_weekly";

  LookupHints() {
    device.bag["download_resources_list"] = {"lookup_hints_weekly", "lookup_hints_monthly", "other"};
    device.bag["lookup_hints_weekly"] = kWeekly;
    device.bag["lookup_hints_monthly"] = "https://files.test/hints/monthly?version=9";
    device.bag["other"] = "https://files.test/other?version=1";
    device.service.on("/hints/monthly", answering("monthly words"));
    device.service.on("/other", answering("others"));
    publish("1");
  }
  /// The service has these weekly hints.
  void publish(const std::string& number) {
    platform::simulated::Scripted answer = answering("weekly words " + number);
    answer.url = "https://files.test/store/en/US/" + number + "/hints";
    device.service.on("/hints/weekly", answer);
  }
  void fetch() {
    device.publishBag();
    device.advance(24h);
  }
  std::string kept(const std::string& name) {
    const auto found = device.platform.fileManager().files().find("/state/hints/" + name);
    return found == device.platform.fileManager().files().end() ? "-" : found->second;
  }
  void post(std::string_view name, std::map<std::string, std::any> userInfo) {
    device.platform.notificationCenter().post({name, nullptr, std::move(userInfo)});
    device.run();
  }
};

TEST_F(LookupHints, AHintFileIsHandedOverAsItArrivesAndAgainUntilItsVersionIsKnown) {
  device.start();
  EXPECT_EQ(kept("2") + kept("3"), "--");
  device.advance(24h);
  EXPECT_EQ(kept("2"), "weekly words 1");
  EXPECT_EQ(kept("3"), "monthly words");
  EXPECT_TRUE(device.log.contains("processing lookup hints for location: "));
  EXPECT_EQ(device.log.count("sourceKind: "), 2u) << "other resources are nobody's hints";

  publish("2");
  fetch();
  EXPECT_EQ(kept("2"), "weekly words 2");
  device.restart();
  EXPECT_EQ(kept("2.signature"), "US-2-en");
  EXPECT_EQ(kept("3.signature"), "9");
  const auto before = device.log.count("requires reprocessing");
  device.restart();
  EXPECT_EQ(device.log.count("requires reprocessing"), before) << "versions and signatures agree";
  EXPECT_EQ(device.log.count("reprocessing lookup hints files"), 3u);
  EXPECT_EQ(device.log.count(platform::LogLevel::error, "Sable_LookUp"), 0u);
}

TEST_F(LookupHints, WhatTheDetectorsHaveLostOrHaveOfAnotherVersionIsHandedOverAtTheNextStart) {
  device.start();
  device.advance(24h);
  device.restart();
  for (const char* name : {"2", "2.signature", "3.signature"})
    ASSERT_TRUE(device.platform.fileManager().remove(std::string("/state/hints/") + name));
  ASSERT_TRUE(device.platform.fileManager().writeAtomically("/state/hints/3.signature", "8"));
  device.log.clear();
  device.restart();
  EXPECT_TRUE(device.log.contains(
      "signature ((null)) does not match version (US-1-en), DD for kind: 2 requires reprocessing"));
  EXPECT_TRUE(
      device.log.contains("signature (8) does not match version (9), DD for kind: 3 requires reprocessing"));
  EXPECT_EQ(kept("2") + kept("2.signature") + kept("3.signature"), "weekly words 1US-1-en9");
}

TEST_F(LookupHints, AFileThatIsGoneOrCannotBeKeptIsToldOfAndLosesNothing) {
  device.start();
  device.advance(24h);
  device.restart();
  auto& files = device.platform.fileManager();
  post(kSBLFileDeletedNotification, {{"identifier", std::string("lookup_hints_weekly")}});
  EXPECT_TRUE(device.log.contains("processing lookup hints for location: (null) sourceKind: 2"));
  EXPECT_EQ(device.log.count("error trying to open hints file: "), 1u);
  post(kSBLFileDeletedNotification, {{"identifier", std::string("other")}});
  post(kSBLFileDeletedNotification, {});
  EXPECT_EQ(device.log.count("error trying to open hints file: "), 1u);

  ASSERT_TRUE(files.writeAtomically("/huge", std::string((64u << 20) + 1, 'x')));
  post(kSBLFileDownloadCompletedNotification,
       {{"identifier", std::string("lookup_hints_weekly")}, {"url", std::filesystem::path("/huge")}});
  EXPECT_EQ(device.log.count("failed to push data to data detectors"), 1u);
  EXPECT_EQ(kept("2") + kept("2.signature"), "weekly words 1US-1-en");

  ASSERT_TRUE(files.remove(kWeeklyFile));
  ASSERT_TRUE(files.remove("/state/hints/2.signature"));
  device.restart();
  EXPECT_EQ(device.log.count("reprocess file doesn't exist or there was an error. file: "), 1u);
  EXPECT_EQ(kept("2"), "weekly words 1");
}

TEST_F(LookupHints, WhileTheUserWantsNoLookupsNoHintsAreFetched) {
  const auto disable = [&](bool disabled) {
    device.platform.userDefaults().setShared("com.kestrel.lookup.shared", "LookupSuggestionsDisabled",
                                             disabled);
  };
  disable(true);
  device.start();
  device.advance(24h);
  EXPECT_EQ(device.sent("/hints") + device.sent("/other"), 1u);
  EXPECT_EQ(kept("2") + kept("3"), "--");
  EXPECT_TRUE(device.log.contains("lookup_hints_weekly is disabled, not downloading"));
  disable(false);
  fetch();
  EXPECT_EQ(kept("2"), "weekly words 1");
  disable(true);
  publish("2");
  fetch();
  EXPECT_EQ(device.sent("/hints"), 2u);
  EXPECT_EQ(device.platform.fileManager().files().at(kWeeklyFile), "weekly words 1") << "it stays";
}

}  // namespace
}  // namespace sable::test

#include <gtest/gtest.h>

#include <nlohmann/json.hpp>

#include "tests/support/TemporaryFolder.h"
#include "tools/sablectl/AnswerOutput.h"
#include "tools/sablectl/ImageFile.h"
#include "tools/sablectl/RecordDocument.h"
#include "tools/sablectl/RequestRecord.h"
#include "tools/sablectl/StreamRows.h"
#include "tools/sablectl/Text.h"
#include "tools/sablectl/UploadsCommand.h"

// What sablectl makes of what comes from outside: nothing harmful, columns that hold, and a JSON
// form that others read.
namespace sable::sablectl {
namespace {

TEST(Text, WhatATerminalWouldObeyIsSpelledOut) {
  const struct {
    std::string_view text, shown;
  } cases[] = {
      {"plain \"text\" naïve 日本", "plain \"text\" naïve 日本"},
      {"\x1b[31mred\x1b]0;title\x07", "\\u001b[31mred\\u001b]0;title\\u0007"},
      {"a\nb\r\tc\x7f", "a\\u000ab\\u000d\\u0009c\\u007f"},
      {"\xc2\x9b"
       "2J",
       "\\u009b2J"},
      {"evil\u202Egpj.exe\u2066", "evil\\u202egpj.exe\\u2066"},
      {"bad \xff\xc3(", "bad \uFFFD\uFFFD("},
      {std::string_view("nul\0!", 5), "nul\\u0000!"},
  };
  for (const auto& [text, shown] : cases) EXPECT_EQ(printable(text), shown);
  EXPECT_EQ(printable("a\nb\x1b", Newlines::keep), "a\nb\\u001b");
}

TEST(Text, IsMeasuredAndCutInColumns) {
  const struct {
    std::string_view text;
    std::size_t width;
    std::string_view cutToFour;
  } cases[] = {{"", 0, ""},          {"four", 4, "four"},
               {"five5", 5, "fiv…"}, {"日本", 4, "日本"},
               {"日本語", 6, "日…"}, {"e\u0301e\u0301e\u0301e\u0301x", 5, "e\u0301e\u0301e\u0301…"}};
  for (const auto& [text, width, cutToFour] : cases) {
    EXPECT_EQ(displayWidth(text), width) << text;
    EXPECT_EQ(cut(text, 4), cutToFour);
  }
  EXPECT_EQ(aligned({{"日", "b"}, {"long", "c"}, {"x", ""}}),
            (std::vector<std::string>{"日    b", "long  c", "x"}));
  EXPECT_EQ(characters("ae\u0301日"), (std::vector<std::string>{"a", "e\u0301", "日"}));
}

TEST(Uploads, AreInflatedWholeOrNotAtAll) {
  using namespace std::string_literals;
  EXPECT_EQ(inflateUpload("\x8b\x8e\x05\x00"s).value(), "[]");
  for (const auto& bad : {""s, "\x8b"s, "\x8b\x8e"s, "no stream"s}) EXPECT_FALSE(inflateUpload(bad)) << bad;
}

TEST(ImageFile, TypesAreToldByTheFirstBytes) {
  const std::pair<std::string_view, std::string_view> cases[] = {
      {"\x89PNG\r\n\x1a\n...", "png"},
      {"\xff\xd8\xff\xe0", "jpeg"},
      {"GIF89a", "gif"},
      {"RIFF____WEBPVP8 ", "webp"},
      {std::string_view("\0\0\0 ftypavif", 12), "avif"},
      {"<html>", "?"},
      {"RIFF", "?"},
      {"", "?"}};
  for (const auto& [bytes, type] : cases) EXPECT_EQ(imageType(bytes), type) << bytes;
}

TEST(ImageFile, NamesArePlainAndNothingIsOverwritten) {
  const std::pair<std::string, std::string> cases[] = {{"http://h/a/b.png", "b.png"},
                                                       {"http://h/x?y=/etc/passwd", "x"},
                                                       {"http://h/", "image"},
                                                       {"http://h/..", "image"},
                                                       {"http://h/.bashrc", "bashrc"},
                                                       {"http://h/a%2fb\\c d", "a_2fb_c_d"},
                                                       {"section.noun", "section.noun"},
                                                       {"\x1b[31m", "__31m"},
                                                       {std::string(300, 'x'), std::string(100, 'x')}};
  for (const auto& [text, name] : cases) EXPECT_EQ(imageFileName(text), name) << text;

  const TemporaryFolder folder;
  const auto outside = folder / "outside", save = folder / "save";
  EXPECT_EQ(saveImage(save, "a.png", "first"), save / "a.png");
  EXPECT_EQ(saveImage(save, "a.png", "second"), save / "a-2.png");
  std::filesystem::create_symlink(outside, save / "link");
  EXPECT_EQ(saveImage(save, "link", "third"), save / "link-2");
  EXPECT_FALSE(std::filesystem::exists(outside));
  EXPECT_FALSE(saveImage(folder / "no" / "such", "a.png", "x"));
}

Answer answerWith(std::string data, bool fromNetwork) {
  Answer answer{.queryId = 7, .reply = SBLReply(), .error = {}, .verbose = true, .milliseconds = 1.23456};
  answer.reply->scale = 2;
  answer.reply->data = makeData(std::move(data));
  if (fromNetwork) {
    answer.reply->httpRequest.emplace().url = "http://a/";
    answer.reply->httpRequest->headers.add("X", "1");
    answer.reply->httpResponse.emplace().status = 404;
  }
  return answer;
}

TEST(AnswerDocument, HasTheDocumentedForm) {
  const auto expected = [](const char* text) { return Dictionary::parse(text); };
  EXPECT_EQ(answerDocument(answerWith(R"([{"query":"q"}])", true)), expected(R"({
      "query_id": 7,
      "reply": {"scale": 2.0, "data": [{"query": "q"}], "source": "network",
                "http_request": {"url": "http://a/", "method": "GET", "headers": {"X": "1"}},
                "http_response": {"url": "", "status": 404, "headers": {}}},
      "error": null, "milliseconds": 1.235})"));
  EXPECT_EQ(answerDocument(answerWith("<html>", false)), expected(R"({
      "query_id": 7,
      "reply": {"scale": 2.0, "data": "<html>", "source": "cache", "http_request": null, "http_response": null},
      "error": null, "milliseconds": 1.235})"));
  const Answer failed{
      .queryId = 1, .reply = {}, .error = Error{"D", 2, "why"}, .verbose = true, .milliseconds = 0};
  EXPECT_EQ(answerDocument(failed), expected(R"({"query_id": 1, "reply": null,
      "error": {"code": 2, "domain": "D", "reason": "why"}, "milliseconds": 0.0})"));
  Answer terse = answerWith("[]", false);
  terse.verbose = false;
  EXPECT_TRUE(answerDocument(terse)["reply"]["source"].is_null()) << "nobody has asked for it";
}

TEST(AnswerLines, ShowHostileResultsHarmlesslyWithinTheWidth) {
  const Answer answer = answerWith(
      R"([{"query":"w\u001b[2J","results":[
           {"title":"One\nTwo","url":"http://example.org/a/long/way","description":"日本語日本語日本語日本語日本語日本語"},
           {"title":3,"url":null},"no object"]}])",
      true);
  const Output output{.json = false, .colours = false, .width = 50};
  const auto lines = answerLines(output, answer);
  ASSERT_EQ(lines.size(), 6u);
  EXPECT_TRUE(lines[0].starts_with("query 7  network  HTTP 404  1.2 ms  ")) << lines[0];
  EXPECT_EQ(lines[2], "w\\u001b[2J");
  EXPECT_EQ(lines[3], "  One\\u000aTwo  http://example.…  日本語日本語日…");
  for (const auto& line : lines) EXPECT_LE(displayWidth(line), output.width) << line;
}

TEST(AnswerLines, TellWhatIsNoListOfResults) {
  const Output output;
  EXPECT_EQ(answerLines(output, answerWith("not\x1b JSON", false)).at(1), "not\\u001b JSON");
  EXPECT_EQ(answerLines(output, answerWith(R"({"title":"\u009b"})", false)).at(1),
            "{\n  \"title\": \"\\u009b\"\n}");
  EXPECT_EQ(answerLines(output, answerWith("[]", false)).at(1), "no results");
  const auto none = answerLines(output, Answer{.queryId = 1, .reply = {}, .error = {}});
  EXPECT_TRUE(none.at(1).starts_with("no reply")) << none[1];
}

TEST(Completion, IsTheFirstQueryThatBeginsWithWhatIsTyped) {
  const struct {
    const char* data;
    std::optional<std::string> completion;
  } cases[] = {{R"([{"query":"a"},{"query":"b"}])", "a"},
               {R"([{"query":"wear"},{"query":"Weather"},{"query":"weather radar"}])", "Weather"},
               {R"([{"query":1}])", std::nullopt},
               {R"([])", std::nullopt},
               {R"({"query":"a"})", std::nullopt},
               {"[", std::nullopt}};
  for (const auto& [data, completion] : cases)
    EXPECT_EQ(bestCompletion(answerWith(data, true), "weat"), completion) << data;
}

TEST(RequestRecord, GivesEachMemberItsType) {
  const auto record =
      requestRecord({"queryId=18446744073709551615", "triggerEvent=-1", "scale=1.5", "verboseReply=true",
                     "queryString=a=b", "queryItems.q=1", "queryItems.q=", "lookupSelectionType=2"});
  ASSERT_TRUE(record) << record.error().reason;
  std::string types;
  for (const auto& [name, value] : record->members())
    types += name + ":" + std::string(value.signature()) + " ";
  EXPECT_EQ(types,
            "queryId:t triggerEvent:x scale:d verboseReply:b queryString:s lookupSelectionType:x "
            "queryItems:a(ss) ");
  EXPECT_EQ(record->unsignedInteger("queryId"), 18446744073709551615u);
  EXPECT_EQ(record->string("queryString"), "a=b");
  const auto& items = std::get<platform::RelayStringPairs>(*record->find("queryItems"));
  EXPECT_EQ(items.pairs, (std::vector<std::pair<std::string, std::string>>{{"q", "1"}, {"q", ""}}));
}

TEST(RequestRecord, RefusesWhatNoRequestHas) {
  for (const char* word : {"queryID=1", "queryItems=1", "queryId=-1", "queryId=1x", "queryId=", "scale=wide",
                           "verboseReply=yes", "noequals", "=1"}) {
    EXPECT_FALSE(requestRecord({word})) << word;
  }
}

TEST(RecordDocument, BecomesATable) {
  platform::RelayRecord one, two;
  one.add("identifier", std::string("a\x1b"));
  two.add("identifier", std::string("b"));
  two.add("open", true);
  EXPECT_EQ(tableLines(recordDocuments({one, two})),
            (std::vector<std::string>{"identifier  open", "a\\u001b", "b           true"}));
  EXPECT_EQ(tableLines(Dictionary::array()), std::vector<std::string>{"none"});
}

TEST(StreamRows, HoldTheirColumnsTheirWidthAndNothingHarmful) {
  Output output;
  output.width = 80;
  const platform::WallTime time(std::chrono::milliseconds(7));
  const auto row = [&](const char* feedback) {
    return feedbackRow(output, time, Dictionary::parse(feedback));
  };
  const std::string::size_type what = feedbackHeading(output).find("what");
  const struct {
    const char* feedback;
    std::string_view cells;  // behind the time
  } cases[] = {
      {R"({"type": "search_start", "query_id": 4, "results": [1, 2], "more": {"a": 1}, "trigger_event": "tap",
           "input": "w", "timestamp": 12})",
       "search_start                  4  input=w  trigger_event=tap  results=[2]  more={1}"},
      {R"({"type": "error", "query_id": 0, "a": null, "b": false, "c": "", "d": "unknown", "e": -1})",
       "error                            e=-1"},
      {R"({"uuid": "79A14834-90CD-4DE4-AD1B-9B2F33E4C7D1", "x\u001b": "\u202e"})",
       "                                 uuid=79A14834  x\\u001b=\\u202e"},
      {R"("no object")", "                                 no object"},
  };
  for (const auto& [feedback, cells] : cases) {
    EXPECT_EQ(row(feedback).substr(what - 33), cut(cells, output.width - (what - 33))) << feedback;
    EXPECT_LE(displayWidth(row(feedback)), output.width);
  }
  const std::string session = sessionRow(output, time,
                                         {{"fb", {1, 2, 3}},
                                          {"agent", "Sabled/1.0 (Linux; Debian 12) Rover/1 (x) y"},
                                          {"user_guid", "79A14834-90CD"},
                                          {"previous_session_end_reason", "idle"}});
  EXPECT_EQ(session.substr(14), "      3  79A14834  idle                     Rover/1 (x) y");
  EXPECT_EQ(sessionHeading(output).find("agent"), session.find("Rover/1"));
  EXPECT_EQ(sessionRow(output, time, {{"other", 1}}).substr(14), R"({"other":1})");
  EXPECT_EQ(droppedRow(output, time, 3).substr(14),
            "3 records left out: they came faster than they were read");
}

}  // namespace
}  // namespace sable::sablectl

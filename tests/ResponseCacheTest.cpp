#include <gtest/gtest.h>
#include <sqlite3.h>

#include <fstream>

#include "platform/host/CacheFile.h"
#include "platform/host/ResponseCache.h"
#include "platform/simulated/SimulatedLog.h"
#include "platform/simulated/SimulatedRuntime.h"
#include "tests/support/TemporaryFolder.h"

namespace sable::platform::host {
namespace {

using std::chrono::hours;
using std::chrono::seconds;
using Fields = std::vector<std::pair<std::string, std::string>>;

// Sun, 06 Nov 1994 08:49:37 GMT, the date that RFC 9110 is fond of.
constexpr WallTime kDate{seconds(784111777)};
constexpr const char* kDateText = "Sun, 06 Nov 1994 08:49:37 GMT";
constexpr const char* kMinuteLater = "Sun, 06 Nov 1994 08:50:37 GMT";

HTTPHeaders headers(const Fields& fields) {
  HTTPHeaders result;
  for (const auto& [name, value] : fields) result.add(name, value);
  return result;
}

HTTPRequest get(const Fields& fields = {}) {
  HTTPRequest request;
  request.url = "http://h/";
  request.headers = headers(fields);
  return request;
}

TEST(CacheRules, WhatMayBeStored) {
  const Fields fresh{{"Cache-Control", "max-age=60"}};
  for (const int status : {200, 203, 404, 410})
    EXPECT_TRUE(isStorable(get(), status, headers(fresh))) << status;
  for (const int status : {204, 206, 301, 302, 304, 500})
    EXPECT_FALSE(isStorable(get(), status, headers(fresh))) << status;
  const struct {
    Fields request, response;
    bool storable;
  } rows[] = {
      {{}, {}, false},
      {{}, {{"cache-control", "PRIVATE, Max-Age=\"60\""}}, true},
      {{}, {{"Cache-Control", "max-age=0"}}, false},
      {{}, {{"Cache-Control", "max-age=-1"}}, false},
      {{}, {{"Cache-Control", "max-age=1x"}}, false},
      {{}, {{"Cache-Control", "max-age=60"}, {"Cache-Control", "max-age=0"}}, false},
      {{}, {{"Cache-Control", "max-age=99999999999999999999"}}, true},
      {{}, {{"Cache-Control", "x=\"no-store, a\\\"\", max-age=1"}}, true},
      {{}, {{"Cache-Control", "max-age=60"}, {"Cache-Control", "no-store"}}, false},
      {{{"Cache-Control", "no-store"}}, fresh, false},
      {{}, {{"Cache-Control", "max-age=60, no-cache"}}, false},
      {{}, {{"Cache-Control", "no-cache"}, {"ETag", "\"1\""}}, true},
      {{}, {{"Last-Modified", kDateText}}, true},
      {{}, {{"Date", kDateText}, {"Expires", kMinuteLater}}, true},
      {{}, {{"Date", kDateText}, {"Expires", kDateText}}, false},
      {{}, {{"Expires", "0"}}, false},
      {{}, {{"ETag", "\"1\""}, {"Vary", "Accept, *"}}, false},
      {{}, {{"ETag", "\"1\""}, {"Vary", "Accept"}}, true},
  };
  for (const auto& row : rows) {
    EXPECT_EQ(isStorable(get(row.request), 200, headers(row.response)), row.storable)
        << headers(row.request).description() << headers(row.response).description();
  }
}

TEST(CacheRules, WhatMayBeReused) {
  using enum Reuse;
  const struct {
    Fields request, response;
    int secondsLater;
    Reuse expected;
  } rows[] = {
      {{}, {{"Cache-Control", "max-age=60"}}, 59, asItIs},
      {{}, {{"Cache-Control", "max-age=60"}}, 60, never},
      {{}, {{"Cache-Control", "max-age=60"}, {"ETag", "1"}}, 60, afterValidation},
      {{}, {{"Cache-Control", "max-age=60"}, {"Expires", kDateText}}, 59, asItIs},
      {{}, {{"Cache-Control", "s-maxage=0, max-age=60"}}, 59, asItIs},
      {{}, {{"Cache-Control", "max-age=60, no-cache"}, {"ETag", "1"}}, 0, afterValidation},
      {{}, {{"Cache-Control", "max-age=60"}, {"Age", "50"}}, 9, asItIs},
      {{}, {{"Cache-Control", "max-age=60"}, {"Age", "50"}}, 10, never},
      {{}, {{"Cache-Control", "max-age=60"}, {"Date", "Sun, 06 Nov 1994 08:48:38 GMT"}}, 0, asItIs},
      {{}, {{"Cache-Control", "max-age=60"}, {"Date", "Sun, 06 Nov 1994 08:48:37 GMT"}}, 0, never},
      {{}, {{"Cache-Control", "max-age=60"}, {"ETag", "1"}}, -1, afterValidation},  // the clock went back
      {{}, {{"Expires", kMinuteLater}}, 59, asItIs},
      {{}, {{"Expires", kMinuteLater}}, 60, never},
      {{}, {{"Expires", "0"}, {"Last-Modified", kDateText}}, 0, afterValidation},
      {{}, {{"Last-Modified", "Sun, 06 Nov 1984 08:49:37 GMT"}}, 0, afterValidation},
      {{{"Cache-Control", "no-cache"}}, {{"Cache-Control", "max-age=60"}}, 0, never},
      {{{"Pragma", "no-cache"}}, {{"Cache-Control", "max-age=60"}}, 0, never},
      {{{"Cache-Control", "max-age=5"}}, {{"Cache-Control", "max-age=60"}}, 5, asItIs},
      {{{"Cache-Control", "max-age=5"}}, {{"Cache-Control", "max-age=60"}}, 6, never},
      {{{"Cache-Control", "min-fresh=10"}}, {{"Cache-Control", "max-age=60"}}, 49, asItIs},
      {{{"Cache-Control", "min-fresh=10"}}, {{"Cache-Control", "max-age=60"}}, 50, never},
      {{{"Cache-Control", "max-stale"}}, {{"Cache-Control", "max-age=60"}}, 61, never},
  };
  for (const auto& row : rows) {
    const StoredResponse stored{"http://h/", 200, headers(row.response), {}, makeData(""), kDate, kDate};
    EXPECT_EQ(reuse(stored, get(row.request), kDate + seconds(row.secondsLater)), row.expected)
        << headers(row.request).description() << headers(row.response).description() << row.secondsLater;
  }
}

TEST(CacheRules, VariantsAnswerTheirOwnRequests) {
  const auto response = headers({{"Cache-Control", "max-age=60"}, {"Vary", "Accept-Language, x-none"}});
  StoredResponse stored{"http://h/", 200, response, {}, makeData(""), kDate, kDate};
  stored.varied = variedFields(headers({{"accept-language", "de"}, {"Accept-Language", " fr"}}), response);
  EXPECT_EQ(reuse(stored, get({{"Accept-Language", "de, fr"}, {"Y", "1"}}), kDate), Reuse::asItIs);
  for (const Fields& other :
       {Fields{}, {{"Accept-Language", "de"}}, {{"Accept-Language", "de, fr"}, {"X-None", "1"}}})
    EXPECT_EQ(reuse(stored, get(other), kDate), Reuse::never);
}

TEST(CacheRules, AValidationRenewsHeadersAndTimes) {
  const auto old = headers(
      {{"Date", kDateText}, {"Age", "9"}, {"ETag", "1"}, {"X", "a"}, {"X", "b"}, {"Content-Length", "2"}});
  const StoredResponse stored{"http://h/", 200, old, {}, makeData("hi"), kDate, kDate};
  HTTPHeaders conditions;
  addConditions(stored, conditions);
  EXPECT_EQ(conditions.fields(), (Fields{{"If-None-Match", "1"}}));
  const auto later = kDate + hours(1);
  const Fields answered{{"X", "c"}, {"X", "d"}, {"Content-Length", "0"}, {"Cache-Control", "max-age=60"}};
  const auto renewed = validated(stored, headers(answered), later, later);
  const Fields expected{
      {"ETag", "1"}, {"Content-Length", "2"}, {"X", "c"}, {"X", "d"}, {"Cache-Control", "max-age=60"}};
  EXPECT_EQ(renewed.headers.fields(), expected);
  EXPECT_EQ(*renewed.body, "hi");
  EXPECT_EQ(reuse(renewed, get(), later + seconds(59)), Reuse::asItIs);
}

class CacheInAFolder : public ::testing::Test {
 protected:
  std::shared_ptr<ResponseCache> cache(std::size_t memory, std::size_t disk) {
    return std::make_shared<ResponseCache>(runtime_, runtime_.serialQueue("owner"), file_, memory, disk);
  }

  static StoredResponse response(const std::string& url, std::string body) {
    const auto own = headers({{"ETag", "1"}, {"X", ""}}), varied = headers({{"Y", "y"}});
    return {url, 200, own, varied, makeData(std::move(body)), kDate, kDate + seconds(1)};
  }

  std::optional<std::string> bodyOf(ResponseCache& cache, const std::string& url) {
    std::optional<std::string> body;
    int answers = 0;
    cache.find(url, [&](ResponseCache::Stored stored) {
      ++answers;
      if (stored) body = *stored->body;
    });
    runtime_.run();
    EXPECT_EQ(answers, 1);
    return body;
  }

  const TemporaryFolder folder_;
  const std::filesystem::path file_ = folder_ / "http/cache.db";
  simulated::SimulatedRuntime runtime_;
};

TEST_F(CacheInAFolder, ResponsesOutliveTheProcess) {
  EXPECT_EQ(bodyOf(*cache(1000, 1000), "a"), std::nullopt);
  EXPECT_FALSE(std::filesystem::exists(file_)) << "nothing to keep, no file";
  {
    const auto first = cache(1000, 10000);
    first->store(response("a", std::string("1\0x", 3)));
    first->store(response("b", "2"));
    first->store(response("b", "3"));
    first->remove("a");
    first->store(response("a", std::string("4\0x", 3)));
  }
  runtime_.run();
  const auto mode = [](const auto& path) { return std::filesystem::status(path).permissions(); };
  EXPECT_EQ(mode(file_), std::filesystem::perms(0600));
  EXPECT_EQ(mode(file_.parent_path()), std::filesystem::perms(0700));

  const auto second = cache(1000, 10000);
  EXPECT_EQ(bodyOf(*second, "a"), std::string("4\0x", 3));
  EXPECT_EQ(bodyOf(*second, "b"), "3");
  EXPECT_EQ(bodyOf(*second, "c"), std::nullopt);
  second->find("a", [](ResponseCache::Stored stored) {
    const auto expected = response("a", "");
    EXPECT_EQ(stored->headers.fields(), expected.headers.fields());
    EXPECT_EQ(stored->varied.fields(), expected.varied.fields());
    EXPECT_EQ(stored->requestTime, expected.requestTime);
    EXPECT_EQ(stored->responseTime, expected.responseTime);
  });
  second->remove("a");
  second->purgeMemory();
  second->rest();
  EXPECT_EQ(bodyOf(*second, "a"), std::nullopt);
  EXPECT_EQ(bodyOf(*second, "b"), "3");
}

TEST_F(CacheInAFolder, WhatChangesWhileTheFileIsReadCounts) {
  const auto cache = this->cache(1000, 10000);
  for (const char* url : {"a", "b"}) cache->store(response(url, "old"));
  runtime_.run();
  cache->purgeMemory();
  std::vector<std::string> found;
  for (const char* url : {"a", "b"})
    cache->find(url, [&](ResponseCache::Stored stored) { found.push_back(stored ? *stored->body : "-"); });
  cache->store(response("a", "new"));
  cache->remove("b");
  runtime_.run();
  EXPECT_EQ(found, (std::vector<std::string>{"new", "-"}));
  EXPECT_EQ(bodyOf(*cache, "a"), "new");
  EXPECT_EQ(bodyOf(*cache, "b"), std::nullopt);
}

TEST_F(CacheInAFolder, TheLeastRecentlyUsedGoFirst) {
  const auto memoryOnly = cache(1000, 0);
  const auto diskOnly = cache(0, 1000);
  for (const auto& cache : {memoryOnly, diskOnly}) {
    // 1 byte of URL and 12 of headers each: twenty fit, and a 21st drives one out.
    for (char url = 'a'; url < 'a' + 20; ++url)
      cache->store(response(std::string(1, url), std::string(37, 'x')));
    EXPECT_TRUE(bodyOf(*cache, "a"));
    cache->store(response("z", std::string(37, 'x')));
    runtime_.run();
    EXPECT_TRUE(bodyOf(*cache, "a"));
    EXPECT_FALSE(bodyOf(*cache, "b"));
    EXPECT_TRUE(bodyOf(*cache, "c"));
    // More than a tenth of the capacity is not kept, and what it replaces is gone.
    cache->store(response("c", std::string(100, 'x')));
    EXPECT_FALSE(bodyOf(*cache, "c"));
    EXPECT_TRUE(bodyOf(*cache, "d"));
  }
  EXPECT_TRUE(std::filesystem::exists(file_));
}

TEST_F(CacheInAFolder, AFileThatIsNoCacheIsReplacedOnce) {
  const auto garbage = [&] { writeFile(file_, std::string(5000, 'g')); };
  const auto foreign = [&] {
    sqlite3* database = nullptr;
    ASSERT_EQ(sqlite3_open(file_.c_str(), &database), SQLITE_OK);
    ASSERT_EQ(sqlite3_exec(database, "CREATE TABLE responses(x)", nullptr, nullptr, nullptr), SQLITE_OK);
    sqlite3_close(database);
  };
  const auto damaged = [&] {
    cache(0, 100000)->store(response("old", std::string(9000, 'x')));
    runtime_.run();
    std::fstream file(file_, std::ios::in | std::ios::out | std::ios::binary);
    file.seekp(4096);
    file << std::string(12000, '\xff');
  };
  for (const auto& spoil : std::initializer_list<std::function<void()>>{garbage, foreign, damaged}) {
    std::filesystem::remove_all(file_.parent_path());
    std::filesystem::create_directory(file_.parent_path());
    spoil();
    const simulated::SimulatedLog log;
    {
      const auto cache = this->cache(0, 100000);
      EXPECT_FALSE(bodyOf(*cache, "old"));
      cache->store(response("a", "1"));
      cache->store(response("b", "2"));
      EXPECT_EQ(bodyOf(*cache, "b"), "2");
    }
    runtime_.run();
    EXPECT_EQ(bodyOf(*cache(0, 100000), "b"), "2");
    runtime_.run();
    EXPECT_EQ(log.count(LogLevel::error), 1u);
  }
}

TEST_F(CacheInAFolder, WithoutAFileMemoryStillServes) {
  writeFile(folder_ / "http", "in the way");
  const simulated::SimulatedLog log;
  const auto cache = this->cache(1000, 1000);
  cache->store(response("a", "1"));
  cache->store(response("b", "2"));
  EXPECT_EQ(bodyOf(*cache, "a"), "1");
  cache->purgeMemory();
  EXPECT_EQ(bodyOf(*cache, "a"), std::nullopt);
  runtime_.run();
  EXPECT_EQ(log.count(LogLevel::error), 1u);
}

}  // namespace
}  // namespace sable::platform::host

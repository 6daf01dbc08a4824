#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <any>
#include <cerrno>

#include "SableKit/SBLConstants.h"
#include "SableKit/SBLRelayCoding.h"
#include "SableKit/SBLRelayInterfaces.h"
#include "sabled/ClientSession.h"
#include "sabled/ClientSessionManager.h"
#include "sabled/DownloadManager.h"
#include "sabled/FileContainer.h"
#include "sabled/SBLNetworkRequestFactory.h"
#include "sabled/SablePersistentStorage.h"
#include "tests/support/VirtualDevice.h"

// Resource files on the virtual device: which are fetched when, kept, handed out and dropped.
namespace sable::test {
namespace {

using platform::HTTPErrorCode;
using platform::simulated::RecordedRequest;
using platform::simulated::Scripted;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using Strings = std::vector<std::string>;

constexpr const char* kNotes = "https://service.test/resources/notes?version=3";
constexpr const char* kWeekly = "lookup_hints_weekly";
const json kBoth{{"notes", kNotes}, {"other", "https://service.test/resources/other?version=2"}};

class Downloads : public testing::Test {
 protected:
  Downloads() {
    device.service.on("/resources", answering("text"));
    offer({{"notes", kNotes}});
  }

  DownloadManager& manager() { return *device.assembly().downloadManager; }

  /// The next bag lists these identifiers, each with its URL.
  void offer(const json& resources) {
    device.bag["download_resources_list"] = json::array();
    for (const auto& [identifier, url] : resources.items()) {
      device.bag["download_resources_list"].push_back(identifier);
      device.bag[identifier] = url;
    }
  }
  void newBag(const json& resources) {
    offer(resources);
    device.publishBag();
  }
  void startAndWatch() {
    device.start();
    for (const auto name : {kSBLFileDownloadCompletedNotification, kSBLFileDeletedNotification}) {
      observations.push_back(device.assembly().notificationCenter.observe(
          std::string(name), [this](const platform::Notification& each) {
            std::string word = each.name == kSBLFileDeletedNotification ? "deleted " : "completed ";
            word += std::any_cast<const std::string&>(each.userInfo.at("identifier"));
            if (const auto url = each.userInfo.find("url"); url != each.userInfo.end())
              word += " " + std::any_cast<const std::filesystem::path&>(url->second).string();
            posted.push_back(std::move(word));
          }));
    }
  }
  /// Starts with the files of the first bag in their places.
  void startWithFiles() {
    startAndWatch();
    device.advance(70s);
    forget();
  }
  void forget() {
    device.service.forgetRequests();
    device.log.clear();
    posted.clear();
    reports();
  }

  /// From now on files are "late", and half a minute on their way.
  void answerSlowly() { device.service.on("/resources", after(30s, answering("late"))); }

  static std::filesystem::path path(const std::string& identifier) {
    return "/home/user/.cache/com.kestrel.sabled/" + identifier;
  }
  std::string file(const std::string& identifier) {
    return device.platform.fileManager().read(path(identifier), 1000).value_or("(none)");
  }
  std::vector<RecordedRequest> requests() { return device.service.requests("/resources"); }
  /// "identifier reason: reason" of each download that began.
  Strings begun() {
    Strings found;
    for (const auto& line : device.log.lines()) {
      const std::string_view text = line.message, head = "starting download of ";
      if (!text.starts_with(head)) continue;
      const auto end = text.find(" delay: 86400.000000 headers: {");
      found.emplace_back(text.substr(head.size(), end - head.size()));
    }
    return found;
  }
  /// Reasons of the errors that the service will be told of, and of which it has not been told before.
  Strings reports() {
    device.run();
    device.assembly().clientSessionManager->flushSession(nullptr);
    device.run();
    Strings reasons;
    auto& storage = *device.assembly().persistentStorage;
    for (const auto& container : storage.getAvailableSessionHandles()) {
      const json envelope = container->read()->getFeedbacksToSend();
      for (const json& record : envelope["fb"]) {
        if (record["type"] == "error") reasons.push_back(record["error"]["reason"]);
      }
      storage.deleteSessionWithFileContainer(container);
    }
    return reasons;
  }
  /// Why a client is handed no file.
  std::string refusal(const std::string& identifier) {
    const auto answer = device.client().call(
        kSBLDaemonRelay, SBLDaemonRelay::fileHandleAndAttributesForResource, {identifier});
    const auto error = decodeError(std::get<platform::RelayRecord>(answer->at(2)));
    return error ? error->reason : "";
  }
  json described() {
    const auto answer = device.client().call(kSBLDiagnosticsRelay, SBLDiagnosticsRelay::resources);
    return json::parse(std::get<std::string>(answer->at(0)));
  }

  VirtualDevice device;
  Strings posted;
  std::vector<platform::NotificationCenter::Token> observations;
};

TEST_F(Downloads, ANewResourceComesAMinuteAfterItsBag) {
  startAndWatch();
  device.advance(59s);
  EXPECT_THAT(requests(), IsEmpty());
  EXPECT_EQ(described()[0]["state"], "delayed");
  EXPECT_THAT(refusal("notes"), testing::HasSubstr("No such file"));
  device.advance(2s);
  ASSERT_EQ(requests().size(), 1u);
  const auto request = requests()[0].request;
  EXPECT_EQ(request.url, "https://service.test/resources/notes?key=tandem4371&version=3");
  EXPECT_EQ(sentValue(request, "X-Kestrel-Download-Identifier"), "notes");
  EXPECT_EQ(sentValue(request, "If-None-Match"), "-") << "there is none to compare with";
  EXPECT_THAT(begun(), ElementsAre("notes reason: update"));
  EXPECT_EQ(file("notes"), "text");
  EXPECT_EQ(described()[0]["size"], 4);
  EXPECT_THAT(posted, ElementsAre("completed notes " + path("notes").string()));
  EXPECT_EQ(device.counter("resourcefilesfetched"), 2) << "one for the file, one for the end";
  EXPECT_THAT(manager().resourceVersions(), ElementsAre(testing::Pair("notes", "3")));
  EXPECT_EQ(manager().resourceForKey("notes")->url, kNotes);
  EXPECT_EQ(*device.platform.userDefaults().dictionary("download_resources"),
            (json{{"notes", {{"url", kNotes}}}}));
  EXPECT_THAT(reports(), IsEmpty());
}

TEST_F(Downloads, ABagDecidesByUrlAndFileWhatIsFetched) {
  struct Row {
    const char* what;
    std::string url;
    bool lose;
    Strings begun;
  };
  const std::string url = "https://service.test/resources/notes";
  startWithFiles();
  for (const Row& row :
       {Row{"the same", kNotes, false, {}}, Row{"another API key", url + "?key=other&version=3", false, {}},
        Row{"the same without its file", kNotes, true, {"notes reason: missing"}},
        Row{"another version", url + "?version=4", false, {"notes reason: update"}},
        Row{"an item more", url + "?version=4&a=b%2Fc", false, {"notes reason: update"}},
        Row{"in another order", url + "?a=b/c&version=4", false, {}}}) {
    forget();
    EXPECT_EQ(row.lose && !device.platform.fileManager().remove(path("notes")), false);
    newBag({{"notes", row.url}});
    device.advance(70s);
    EXPECT_EQ(begun(), row.begun) << row.what;
    EXPECT_EQ(requests().size(), row.begun.size()) << row.what;
    EXPECT_EQ(file("notes"), "text") << row.what;
  }
}

TEST_F(Downloads, TheServiceHearsWhichVersionIsHeldAndMayLeaveItAtThat) {
  startWithFiles();
  device.service.on("/resources", answering("", 304));
  newBag({{"notes", "https://service.test/resources/notes?version=4"}});
  device.advance(70s);
  ASSERT_EQ(requests().size(), 1u);
  EXPECT_EQ(sentValue(requests()[0].request, "If-None-Match"), "3");
  EXPECT_EQ(file("notes"), "text");
  EXPECT_THAT(posted, IsEmpty());
  EXPECT_THAT(reports(), IsEmpty());
  EXPECT_EQ(manager().resourceVersions().at("notes"), "4");
}

TEST_F(Downloads, HintsForLookupsAreAskedForWithEveryBagByTheVersionOfTheirRedirect) {
  const std::string url = std::string("https://service.test/resources/") + kWeekly;
  Scripted redirected = answering("hints");
  redirected.url = "https://cdn.test/resources/weekly/2026-11-23/7/hints";
  device.service.on("/resources", redirected);
  offer({{kWeekly, url}});
  startWithFiles();
  EXPECT_EQ(manager().resourceVersions().at(kWeekly), "2026-11-23-7-weekly");
  EXPECT_EQ(manager().resourceForKey(kWeekly)->redirectUrl, redirected.url);

  device.service.on("/resources", answering("", 304));
  for (int i = 0; i < 2; ++i) {
    device.publishBag();
    device.advance(70s);
    EXPECT_THAT(begun(), ElementsAre(std::string(kWeekly) + " reason: lookup"));
    ASSERT_EQ(requests().size(), 1u);
    EXPECT_EQ(sentValue(requests()[0].request, "If-None-Match"), "2026-11-23-7-weekly");
    EXPECT_EQ(file(kWeekly), "hints");
    forget();
  }
}

TEST_F(Downloads, HintsForLookupsAreFetchedAnewWhenSearchesComeFromAnotherTown) {
  const auto searchAt = [&](double latitude) {
    device.advance(6min);  // the last fix is too old then
    device.client().search("where " + std::to_string(latitude));
    device.platform.locationService().deliver({latitude, 0, 4, device.platform.runtime().now()});
    device.run();
    device.client().search("what " + std::to_string(latitude));
    device.advance(1s);
  };
  device.platform.locationService().authorize(platform::LocationAuthorization::always);
  device.bag["geo_location_sources"] = {"wifi"};
  offer({{"notes", kNotes}, {kWeekly, "https://service.test/resources/weekly?version=1"}});
  device.start();
  searchAt(51.5);
  device.publishBag();
  device.advance(70s);
  const std::string_view place = "X-Kestrel-FuzzedLatLong";
  EXPECT_EQ(sentValue(device.service.requests("/resources/weekly").back().request, place),
            "51.500000,0.000000");
  EXPECT_EQ(sentValue(device.service.requests("/resources/notes").back().request, place), "-");

  forget();
  searchAt(51.9);
  EXPECT_TRUE(manager().resourceForKey(kWeekly)) << "44 km away";
  searchAt(52.0);
  EXPECT_FALSE(manager().resourceForKey(kWeekly)) << "56 km away";
  EXPECT_TRUE(manager().resourceForKey("notes"));
  EXPECT_EQ(file(kWeekly), "text");
  device.publishBag();
  device.advance(70s);
  ASSERT_EQ(requests().size(), 1u);
  EXPECT_EQ(sentValue(requests()[0].request, "If-None-Match"), "-");
  EXPECT_EQ(sentValue(requests()[0].request, "X-Kestrel-FuzzedLatLong"), "52.000000,0.000000");
}

TEST_F(Downloads, WhatFailsIsReportedOnceAndLeavesTheFileAsItWas) {
  struct Row {
    Scripted answer;
    std::string reported, logged;
  };
  startWithFiles();
  for (const Row& row : {Row{answering("no", 500), "status code 500", "download of notes got a 500 response"},
                         Row{answering("no", 404), "status code 404", "download of notes got a 404 response"},
                         Row{answering("no", 302), "status code 302", ""},
                         Row{failing(HTTPErrorCode::responseTooLarge), "download error HTTPErrorDomain 8",
                             "download task error"}}) {
    forget();
    device.service.on("/resources", row.answer);
    newBag({{"notes",
             "https://service.test/resources/notes?version=" + device.bag["version"].get<std::string>()}});
    device.advance(70s);
    EXPECT_EQ(requests().size(), 1u);
    EXPECT_THAT(reports(), ElementsAre(row.reported));
    EXPECT_TRUE(device.log.contains(row.logged)) << row.logged;
    EXPECT_EQ(file("notes"), "text");
    EXPECT_THAT(posted, IsEmpty());
  }
  forget();
  device.platform.httpSessions().failAccepting(ENOSPC);
  newBag({{"notes", "https://service.test/resources/notes?version=last"}});
  device.advance(70s);
  EXPECT_THAT(reports(), ElementsAre("download error POSIXErrorDomain " + std::to_string(ENOSPC)));
}

TEST_F(Downloads, AFileThatCannotBePutIntoItsPlaceIsLogged) {
  ASSERT_TRUE(device.platform.fileManager().createDirectory(path("notes") / "below"));
  startAndWatch();
  device.advance(70s);
  EXPECT_TRUE(device.log.contains("error copying download POSIXErrorDomain"));
  EXPECT_THAT(posted, IsEmpty());
  EXPECT_EQ(device.counter("resourcefilesfetched"), 1);
}

TEST_F(Downloads, ANewBagTakesBackWhatTheOldOneAskedFor) {
  answerSlowly();
  startAndWatch();
  device.advance(30s);
  device.publishBag();
  device.advance(40s);
  EXPECT_THAT(requests(), IsEmpty()) << "the minute begins anew";
  device.advance(25s);
  EXPECT_EQ(requests().size(), 1u);
  EXPECT_EQ(described()[0]["state"], "in flight");
  newBag(kBoth);
  EXPECT_TRUE(device.log.contains("canceling https://service.test/resources/notes?key="));
  device.advance(50s);
  EXPECT_EQ(file("notes"), "(none)");
  EXPECT_EQ(requests().size(), 1u);
  device.advance(50s);
  EXPECT_EQ(requests().size(), 3u);
  EXPECT_EQ(file("notes"), "late");
  EXPECT_EQ(file("other"), "late");
  EXPECT_THAT(reports(), IsEmpty());
}

TEST_F(Downloads, AnotherDaemonKnowsWhatIsThereAndFetchesWhatWasUnderWay) {
  startWithFiles();
  answerSlowly();
  newBag(kBoth);
  device.advance(65s);
  EXPECT_EQ(requests().size(), 1u);
  forget();
  observations.clear();
  device.restart();
  EXPECT_EQ(manager().resourceVersions().at("notes"), "3");
  EXPECT_TRUE(device.log.contains("canceling https://service.test/resources/other?"));
  device.advance(100s);
  EXPECT_THAT(begun(), ElementsAre("other reason: update"));
  EXPECT_EQ(file("notes"), "text");
  EXPECT_EQ(file("other"), "late");
  EXPECT_THAT(reports(), IsEmpty());
}

TEST_F(Downloads, WhatTheBagDropsIsDeleted) {
  offer(kBoth);
  startWithFiles();
  newBag({{"notes", kNotes}});
  EXPECT_EQ(file("other"), "(none)");
  EXPECT_THAT(posted, ElementsAre("deleted other"));
  newBag(kBoth);
  newBag({{"notes", nullptr}, {"other", "nowhere"}});
  EXPECT_THAT(posted, ElementsAre("deleted other", "deleted notes", "deleted other"));
  EXPECT_EQ(file("notes"), "(none)");
  EXPECT_EQ(described(), json::array());
  device.advance(70s);
  EXPECT_THAT(requests(), IsEmpty()) << "also what was to be fetched";

  newBag(kBoth);
  device.advance(70s);
  device.bag.erase("download_resources_list");
  device.publishBag();
  EXPECT_EQ(file("notes"), "text") << "a bag that says nothing about resources costs none";
}

TEST_F(Downloads, AnIdentifierIsAFileNameOrNothing) {
  Strings refused = {"", ".", "..", "../x", "a/b", "/etc/passwd", "bag.plist", "http"};
  for (const char* name : {"session.12", "flushing.first", "crowdsourcing.first", "temporary", ".hidden"})
    refused.emplace_back(name);
  for (const auto& name : {std::string("a\nb"), std::string("a\0b", 3), std::string(256, 'n')})
    refused.push_back(name);
  const std::string url = "https://service.test/resources/x";
  json resources = {{std::string(255, 'n'), url}};
  for (const std::string& identifier : refused) resources[identifier] = url;
  offer(resources);
  startAndWatch();
  const std::string bag = device.bagFile();
  device.advance(70s);
  EXPECT_EQ(requests().size(), 1u);
  EXPECT_EQ(file(std::string(255, 'n')), "text");
  EXPECT_EQ(device.log.count(" is no name for a resource, not downloading"), refused.size());
  EXPECT_EQ(device.bagFile(), bag);
  for (const std::string& identifier : refused) {
    if (identifier.find('\0') != identifier.npos) continue;  // no string of the wire
    EXPECT_EQ(refusal(identifier),
              "identifier: " + identifier + " exception: no place for a resource of that name");
  }
}

TEST_F(Downloads, ASessionTellsWhichVersionsTheDeviceHeld) {
  startWithFiles();
  device.client().search("weather");
  device.assembly().clientSessionManager->flushSession(nullptr);
  device.run();
  const auto sessions = device.assembly().persistentStorage->getAvailableSessionHandles();
  ASSERT_EQ(sessions.size(), 1u);
  EXPECT_EQ(json(sessions[0]->read()->getFeedbacksToSend())["resource_versions"], (json{{"notes", "3"}}));
}

}  // namespace
}  // namespace sable::test

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <fstream>
#include <future>

#include "tests/support/TemporaryFolder.h"
#include "tests/support/TestClient.h"
#include "tests/support/World.h"

// Images through the real daemon from the reference service. Its answers vouch for 127.0.0.1, which
// it also reaches as localhost: a request there would be recorded.
namespace sable::test {
namespace {

using namespace std::chrono_literals;
using testing::HasSubstr;

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool kSanitized = true;
#else
constexpr bool kSanitized = false;
#endif

/// The most memory the daemon ever had, in KiB.
long peakMemory(pid_t pid) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  for (std::string word; status >> word;) {
    long value = 0;
    if (word == "VmHWM:" && status >> value) return value;
  }
  return 0;
}

class ImagesFromTheService : public testing::Test {
 protected:
  using Loading = std::future<Expected<SBLClient::Images>>;

  explicit ImagesFromTheService(std::vector<std::string> serviceArguments = {})
      : world_({.serviceArguments = std::move(serviceArguments), .settings = "SBLUseBramble = false"}) {
    EXPECT_TRUE(application_.search("dog").reply);
  }

  std::string url(const std::string& name) const { return world_.serviceURL() + "/images/" + name; }
  std::string unvouched(const std::string& name) const {
    const std::string& service = world_.serviceURL();
    return "http://localhost" + service.substr(service.rfind(':')) + "/images/" + name;
  }
  std::string redirect(const std::string& target) const { return url("redirect?to=" + target); }

  Loading begin(const std::vector<std::string>& urls, platform::MonotonicTime deadline) {
    std::vector<SBLImageDescription> descriptions;
    for (const std::string& url : urls) descriptions.push_back({url, std::nullopt});
    const auto promise = std::make_shared<std::promise<Expected<SBLClient::Images>>>();
    application_.client().loadImages(descriptions, deadline, [promise](Expected<SBLClient::Images> images) {
      promise->set_value(std::move(images));
    });
    return promise->get_future();
  }

  SBLClient::Images load(const std::vector<std::string>& urls, platform::Duration wait) {
    auto images = begin(urls, runtime_.ticks() + wait).get();
    EXPECT_TRUE(images) << images.error().description();
    return images.value_or(SBLClient::Images());
  }

  static constexpr platform::Duration kLong = 60s;

  World world_;
  platform::host::HostRuntime runtime_;
  TestClient application_{runtime_, world_.address()};
};

/// With a service that wants nobody to wait longer than 3 s, and sends one image slower than that.
class SlowImages : public ImagesFromTheService {
 protected:
  SlowImages() : ImagesFromTheService({"--fault", "/images/slow.png:slow=20", "--bag", impatientBag()}) {}

 private:
  static std::string impatientBag() {
    static const TemporaryFolder folder;
    writeFile(folder / "bag.json", R"({"request_timeout": 3})");
    return folder / "bag.json";
  }
};

TEST_F(ImagesFromTheService, WhatMayNotOrDoesNotComeIsLeftOutAndTheRestIsDelivered) {
  const std::string huge = url("huge.png?bytes=52428800");
  const std::vector<std::string> all{url("fine.png"),
                                     redirect(url("other.png")),
                                     unvouched("unvouched.png"),
                                     redirect(unvouched("redirected.png")),
                                     redirect("file:///etc/passwd"),
                                     "ftp://127.0.0.1/ftp.png",
                                     url("no such image"),
                                     url("not%20there"),
                                     huge};
  const long before = peakMemory(world_.daemon().pid());
  const auto images = load(all, kLong);
  ASSERT_EQ(images.size(), 2u);
  for (const auto& [name, image] : images) EXPECT_THAT(*image, testing::StartsWith("\x89PNG")) << name;
  EXPECT_NE(*images.at(all[0]), *images.at(all[1]));
  if (!kSanitized) {
    EXPECT_LT(peakMemory(world_.daemon().pid()) - before, 30 << 10)
        << "50 MiB are not gathered to be refused";
  }

  const std::string log = world_.daemonErrors();
  for (const std::string& line :
       {"loadImage with invalid host: " + all[2],
        "loadImage with invalid host: " + unvouched("redirected.png"),
        std::string("loadImage with invalid scheme: file:///etc/passwd"),
        "loadImage with invalid scheme: " + all[5], "no image from " + huge + ": HTTPErrorDomain 8",
        "no image from " + all[7] + ": SBLErrorDomain 2: statusCode 404"}) {
    EXPECT_THAT(log, HasSubstr(line));
  }
  for (const char* name : {"unvouched.png", "redirected.png"}) {
    EXPECT_EQ(world_.requests("/images/" + std::string(name), 0).size(), 0u);
  }
}

TEST_F(SlowImages, OneIsLeftOutAtTheDeadlineAndEndsWithTheTimeoutOfARequest) {
  load({url("quick.png")}, kLong);
  const auto images = load({url("slow.png"), url("quick.png")}, 200ms);
  EXPECT_EQ(images.size(), 1u);
  EXPECT_TRUE(images.contains(url("quick.png")));

  // It never stops to make progress, and this client would wait for ever.
  auto forEver = begin({url("slow.png")}, platform::MonotonicTime::max()).get();
  ASSERT_TRUE(forEver) << forEver.error().description();
  EXPECT_TRUE(forEver->empty());
  EXPECT_THAT(world_.daemonErrors(), HasSubstr("HTTPErrorDomain 4: no image in time"));
}

TEST_F(SlowImages, ThoseWhoWaitKeepNobodyFromHisAnswer) {
  std::vector<Loading> waiting;
  for (int i = 0; i < 10; ++i) {
    waiting.push_back(
        begin({url("slow.png"), url(std::to_string(i) + ".png")}, platform::MonotonicTime::max()));
  }
  world_.requests("/images/slow.png", 1);
  EXPECT_TRUE(application_.search("dog").reply);
  for (Loading& each : waiting) {
    EXPECT_EQ(each.wait_for(0s), std::future_status::timeout);
  }
  for (Loading& each : waiting) {
    const auto images = each.get();
    ASSERT_TRUE(images) << images.error().description();
    EXPECT_EQ(images->size(), 1u);
  }
  EXPECT_EQ(world_.requests("/images/slow.png", 1).size(), 1u) << "all of them share it";
}

TEST_F(ImagesFromTheService, TwoHundredComeAtOnce) {
  std::vector<std::string> all;
  for (int i = 0; i < 200; ++i) all.push_back(url("number-" + std::to_string(i) + ".png"));
  const long before = peakMemory(world_.daemon().pid());
  EXPECT_EQ(load(all, kLong).size(), all.size());
  if (!kSanitized) {
    EXPECT_LT(peakMemory(world_.daemon().pid()) - before, 64 << 10);
  }
  EXPECT_EQ(load(all, 0s).size(), all.size()) << "from memory";
}

TEST_F(ImagesFromTheService, TheToolShowsAndSavesThem) {
  const auto folder = world_.folder("saved");
  const auto answer = world_.sablectlJSON({"images", url("a.png?x=/etc/passwd"), url("a.png"), "--id",
                                           "section.noun", url(".png"), "--save", folder});
  ASSERT_EQ(answer["missing"], 0) << answer;
  std::vector<std::string> files;
  for (const auto& image : answer["images"]) {
    EXPECT_EQ(image["type"], "png");
    files.push_back(image["file"]);
    EXPECT_EQ(readFile(files.back()).size(), image["bytes"]);
    struct stat status;
    ASSERT_EQ(stat(files.back().c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 0777, 0600u);
  }
  EXPECT_THAT(files, testing::UnorderedElementsAre(folder / "a.png", folder / "a-2.png",
                                                   folder / "section.noun", folder / "png"));

  const auto some = world_.sablectl({"images", url("a.png"), unvouched("a.png")});
  EXPECT_EQ(some.exitCode, 1);
  EXPECT_THAT(some.output, HasSubstr(url("a.png") + "  220  png\n"));
  EXPECT_THAT(some.output, HasSubstr(unvouched("a.png") + "  -    -\n"));
  EXPECT_THAT(some.errors, HasSubstr("1 of 2 images did not come"));
  EXPECT_EQ(world_.sablectl({"images"}).exitCode, 2);
}

}  // namespace
}  // namespace sable::test

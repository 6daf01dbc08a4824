#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <openssl/sha.h>
#include <zlib.h>

#include <atomic>
#include <random>

#include "platform/NotificationCenter.h"
#include "platform/host/HostHTTPSession.h"
#include "platform/host/TransferStore.h"
#include "tests/support/World.h"

// Uploads from a state folder to the real service, and what sablectl makes of that folder.
namespace sable::test {
namespace {

using namespace platform;
using testing::HasSubstr;

class Ended final : public HTTPBackgroundSessionDelegate {
 public:
  explicit Ended(Runtime& runtime) : ended_(runtime.semaphore(0)) {}
  void didCompleteWithError(const HTTPBackgroundTask& task, const std::optional<Error>&) override {
    status = task.response ? task.response->status : 0;
  }
  void didFinishEventsForBackgroundURLSession() override { ended_->signal(); }
  void wait() { EXPECT_TRUE(ended_->wait(MonotonicTime::max())); }

  std::atomic<int> status = 0;

 private:
  const std::unique_ptr<Semaphore> ended_;
};

std::string deflated(const std::string& text) {
  z_stream stream{};
  deflateInit2(&stream, 6, Z_DEFLATED, -MAX_WBITS, 8, Z_DEFAULT_STRATEGY);
  std::string bytes(compressBound(text.size()), '\0');
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(text.data()));
  stream.avail_in = static_cast<uInt>(text.size());
  stream.next_out = reinterpret_cast<Bytef*>(bytes.data());
  stream.avail_out = static_cast<uInt>(bytes.size());
  deflate(&stream, Z_FINISH);
  bytes.resize(stream.total_out);
  deflateEnd(&stream);
  return bytes;
}

std::string digestOf(const std::string& text) {
  unsigned char digest[SHA512_DIGEST_LENGTH];
  SHA512(reinterpret_cast<const unsigned char*>(text.data()), text.size(), digest);
  std::string hex;
  for (const unsigned char byte : digest) {
    constexpr const char* kDigits = "0123456789abcdef";
    hex += {kDigits[byte / 16], kDigits[byte % 16]};
  }
  return hex;
}

TEST(Uploads, ThatBreakOffAmidTheBodyArriveOnceAndAreShownToTheOwner) {
  const World world({.serviceArguments = {"--fault", "/feedback:reset-body=1000*1", "--fault",
                                          "/crowdsourcing:slow-body=200000*1"},
                     .startDaemon = false});
  EXPECT_EQ(world.sablectlJSON({"uploads"}), nlohmann::json::array());
  EXPECT_THAT(world.sablectl({"uploads"}).output, HasSubstr("nothing was uploaded yet"));

  std::mt19937 random(1);
  std::string text = "[";
  while (text.size() < 100000) text += std::to_string(random()) + ", ";
  text += "0]";
  writeFile(world.folder("body"), deflated(text));
  host::HostRuntime runtime(2);
  NotificationCenter center;
  Ended ended(runtime);
  host::HostHTTPSessions sessions(
      runtime, world.folder("caches"),
      {center, std::make_shared<host::TransferStore>(world.folder("state"), [] { return true; }),
       [] { return TransferConditions{}; }});
  const auto session = sessions.backgroundSession({.identifier = "test"}, ended);
  for (const char* path : {"/feedback", "/crowdsourcing"}) {
    HTTPRequest request;
    request.url = world.serviceURL() + path;
    request.method = "POST";
    request.headers.add("Content-Encoding", "deflate");
    request.headers.add("X-Kestrel-Digest", digestOf(text));
    session->resume(session->uploadTask(request, world.folder("body"), "", "").value());
    ended.wait();
    EXPECT_EQ(ended.status, 200);
  }
  const auto received = world.requests("/feedback", 2);
  EXPECT_EQ(received[0]["status"], 400) << "what broke off";
  EXPECT_EQ(received[1]["digest_ok"], true);
  EXPECT_EQ(received[1]["repeated"], false);

  const auto uploads = world.sablectlJSON({"uploads"});
  ASSERT_EQ(uploads.size(), 2u);
  EXPECT_EQ(uploads[0]["state"], "ended");
  EXPECT_EQ(uploads[0]["attempts"], 2);
  EXPECT_EQ(uploads[0]["status"], 200);
  EXPECT_EQ(uploads[0]["can_be_shown"], true);
  EXPECT_EQ(world.sablectl({"--json", "uploads", "--show", "1"}).output, text + "\n");
  EXPECT_THAT(world.sablectl({"uploads"}).output, HasSubstr("status 200"));
  EXPECT_EQ(world.sablectl({"uploads", "--show", "9"}).exitCode, 1);
}

}  // namespace
}  // namespace sable::test

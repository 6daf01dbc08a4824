#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "tests/support/World.h"

// What the real daemon uploads, as the reference service receives it.
namespace sable::test {
namespace {

TEST(UploadOfFeedback, IsAcceptedWithItsDigestAlsoOfWhatAKilledDaemonHasRecorded) {
  World world;
  ASSERT_EQ(world.sablectl({"report", "RKStartSearchFeedback", "input=before"}).exitCode, 0);
  ASSERT_EQ(world.sablectl({"dump"}).exitCode, 0);
  ASSERT_EQ(world.sablectl({"report", "RKStartSearchFeedback", "input=after"}).exitCode, 0);
  for (int attempt = 0; attempt < 1000; ++attempt) {  // who reports does not wait for the disk
    if (world.sablectlJSON({"ledger"})["waiting"] == 0) break;
  }
  (void)world.requests("/feedback", 2);  // the bag's fetch has a session of its own
  world.killDaemon();
  world.startDaemon();
  ASSERT_EQ(world.sablectl({"dump"}).exitCode, 0);
  std::string texts;
  for (const auto& request : world.requests("/feedback", 3)) {
    EXPECT_EQ(request["status"], 200);
    EXPECT_EQ(request["digest_ok"], true);
    EXPECT_EQ(request["repeated"], false);
    texts += request["json"].dump();
  }
  EXPECT_THAT(texts, testing::HasSubstr("before"));
  EXPECT_THAT(texts, testing::HasSubstr("after"));
}

}  // namespace
}  // namespace sable::test

#include <gtest/gtest.h>

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

TEST_F(LookupTest, TheUsersSwitchIsReadAnewAtEachCall) {
  device.start();
  EXPECT_TRUE(device.assembly().lookup->lookupEnabled());
  for (const bool disabled : {true, false}) {
    device.platform.userDefaults().setShared("com.kestrel.lookup.shared", "LookupSuggestionsDisabled",
                                             disabled);
    EXPECT_EQ(device.assembly().lookup->lookupEnabled(), !disabled);
  }
}

}  // namespace
}  // namespace sable::test

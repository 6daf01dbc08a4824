#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <string_view>

#include "platform/NotificationCenter.h"

namespace sable::platform {
namespace {

Notification named(std::string_view name) {
  Notification notification;
  notification.name = name;
  return notification;
}

TEST(NotificationCenterTest, ObserversOfTheNameAreCalledInOrder) {
  NotificationCenter center;
  std::string calls;
  const auto first = center.observe("bag", [&](const Notification& notification) {
    calls += "1" + std::any_cast<std::string>(notification.userInfo.at("key"));
  });
  const auto second = center.observe("bag", [&](const Notification&) { calls += "2"; });
  const auto other = center.observe("bag2", [&](const Notification&) { calls += "3"; });
  Notification notification = named("bag");
  notification.userInfo["key"] = std::string("v");
  center.post(notification);
  EXPECT_EQ(calls, "1v2");
}

TEST(NotificationCenterTest, ATokenEndsItsObservation) {
  auto center = std::make_unique<NotificationCenter>();
  int calls = 0;
  const auto count = [&](const Notification&) { ++calls; };
  auto token = center->observe("n", count);
  token = center->observe("n", count);
  center->post(named("n"));
  EXPECT_EQ(calls, 1);
  token.reset();
  EXPECT_FALSE(token);
  center->post(named("n"));
  EXPECT_EQ(calls, 1);
  token = center->observe("n", count);
  center.reset();  // a token may outlive its center
}

TEST(NotificationCenterTest, AnObserverMayPostObserveAndUnregister) {
  NotificationCenter center;
  int removedCalls = 0;
  int innerCalls = 0;
  int lateCalls = 0;
  NotificationCenter::Token self;
  NotificationCenter::Token removed;
  NotificationCenter::Token late;
  const auto inner = center.observe("inner", [&](const Notification&) { ++innerCalls; });
  self = center.observe("n", [&](const Notification&) {
    center.post(named("inner"));
    late = center.observe("n", [&](const Notification&) { ++lateCalls; });
    removed.reset();
    self.reset();
  });
  removed = center.observe("n", [&](const Notification&) { ++removedCalls; });
  center.post(named("n"));
  EXPECT_EQ(innerCalls, 1);
  EXPECT_EQ(removedCalls, 0);
  EXPECT_EQ(lateCalls, 0);
  center.post(named("n"));
  EXPECT_EQ(innerCalls, 1);
  EXPECT_EQ(lateCalls, 1);
}

}  // namespace
}  // namespace sable::platform

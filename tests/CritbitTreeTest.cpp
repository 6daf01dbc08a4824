#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <pthread.h>

#include <algorithm>
#include <map>
#include <random>
#include <string>
#include <vector>

#include "sabled/CritbitTree.h"

namespace sable::test {
namespace {

using testing::ElementsAre;
using Tree = CritbitTree<const int>;

std::vector<std::string> keysBelow(const Tree& tree, const std::string& prefix) {
  std::vector<std::string> keys;
  tree.keysMatchingPrefix(prefix, [&](const char* key, const Tree::Value&) { keys.emplace_back(key); });
  return keys;
}

TEST(Critbit, InsertTellsWhatItDid) {
  std::vector<void*> released;
  static thread_local std::vector<void*>* record = nullptr;
  record = &released;
  critbit_tree tree;
  tree.value_release = [](void* value) { record->push_back(value); };
  int first = 1, second = 2;
  EXPECT_EQ(critbit_insert(&tree, "we", &first, true), 2);
  EXPECT_EQ(critbit_insert(&tree, "we", &first, true), 0) << "the very same value";
  EXPECT_EQ(critbit_insert(&tree, "we", &second, false), 1);
  void* value = nullptr;
  EXPECT_TRUE(critbit_contains(&tree, "we", &value));
  EXPECT_EQ(value, &first) << "not replaced";
  EXPECT_TRUE(released.empty());
  EXPECT_EQ(critbit_insert(&tree, "we", &second, true), 1);
  EXPECT_TRUE(critbit_contains(&tree, "we", &value));
  EXPECT_EQ(value, &second);
  EXPECT_EQ(critbit_insert(&tree, "", &first, false), 2);
  EXPECT_EQ(tree.count, 2u);
  EXPECT_FALSE(critbit_delete(&tree, "w"));
  EXPECT_TRUE(critbit_delete(&tree, "we"));
  EXPECT_FALSE(critbit_contains(&tree, "we", nullptr));
  critbit_clear(&tree);
  EXPECT_THAT(released, ElementsAre(&first, &second, &first));
  EXPECT_EQ(tree.count, 0u);
}

TEST(Critbit, APrefixIsWalkedInTheOrderOfBytes) {
  Tree tree;
  const auto value = std::make_shared<const int>(1);
  EXPECT_THAT(keysBelow(tree, ""), ElementsAre());
  for (const char* key : {"wind", "weather radar", "\xff", "we", "été", "weather", "wea", "\x01"}) {
    EXPECT_TRUE(tree.setObject(value, key));
  }
  EXPECT_THAT(keysBelow(tree, "wea"), ElementsAre("wea", "weather", "weather radar"));
  EXPECT_THAT(keysBelow(tree, ""),
              ElementsAre("\x01", "we", "wea", "weather", "weather radar", "wind", "été", "\xff"));
  EXPECT_THAT(keysBelow(tree, "weather radar"), ElementsAre("weather radar"));
  for (const char* nothing : {"weather radars", "x", "wex", "w\xff"}) {
    EXPECT_THAT(keysBelow(tree, nothing), ElementsAre()) << nothing;
  }
}

TEST(Critbit, ATextWithAZeroByteIsNoKey) {
  Tree tree;
  EXPECT_TRUE(tree.setObject(std::make_shared<const int>(1), "we"));
  for (const std::string& text : {std::string("we\0", 3), std::string("\0", 1), std::string("w\0e", 3)}) {
    EXPECT_FALSE(tree.setObject(std::make_shared<const int>(2), text));
    EXPECT_EQ(tree.objectForKey(text), nullptr);
    EXPECT_THAT(keysBelow(tree, text), ElementsAre());
    tree.removeObjectForKey(text);
  }
  EXPECT_EQ(tree.count(), 1u);
  EXPECT_EQ(*tree.objectForKey("we"), 1);
}

/// Keys that a tree may find hard: few letters, so that they collide and extend one another, bytes at
/// both ends of their range, and now and then a very long one.
std::string hostileKey(std::mt19937& random) {
  constexpr std::string_view kBytes = "a\x01\x7f\x80\xff\xfe";
  const auto kind = random() % 100;
  std::string key(kind == 0 ? 65536 - random() % 3 : random() % 6, 'a');
  for (std::size_t i = kind == 0 ? 65530 : 0; i < key.size(); ++i) key[i] = kBytes[random() % kBytes.size()];
  return key;
}

using Model = std::map<std::string, Tree::Value>;

void expectSamePrefixes(const Tree& tree, const Model& model, const std::string& prefix) {
  auto expected = model.lower_bound(prefix);
  tree.keysMatchingPrefix(prefix, [&](const char* key, const Tree::Value& value) {
    ASSERT_TRUE(expected != model.end() && expected->first.starts_with(prefix));
    EXPECT_EQ(key, expected->first);
    EXPECT_EQ(value, expected->second);
    ++expected;
  });
  EXPECT_TRUE(expected == model.end() || !expected->first.starts_with(prefix));
}

TEST(Critbit, BehavesAsAnOrderedMapWhateverTheKeys) {
  for (unsigned seed = 1; seed <= 4; ++seed) {
    std::mt19937 random(seed);
    Tree tree;
    Model model;
    const auto value = std::make_shared<const int>(static_cast<int>(seed));
    for (int step = 0; step < 4000; ++step) {
      const std::string key = hostileKey(random);
      switch (random() % 5) {
        case 0:
          tree.removeObjectForKey(key);
          model.erase(key);
          break;
        case 1:
          expectSamePrefixes(tree, model, key.substr(0, random() % (key.size() + 1)));
          break;
        default: {
          const auto fresh = step % 2 == 0 ? value : std::make_shared<const int>(step);
          EXPECT_TRUE(tree.setObject(fresh, key));
          model[key] = fresh;
        }
      }
      const auto found = model.find(key);
      ASSERT_EQ(tree.objectForKey(key), found == model.end() ? nullptr : found->second) << step;
      ASSERT_EQ(tree.count(), model.size());
      if (step == 3000) tree.removeAllObjects(), model.clear();
    }
    expectSamePrefixes(tree, model, "");
    const auto held = std::ranges::count_if(model, [&](const auto& entry) { return entry.second == value; });
    EXPECT_EQ(value.use_count(), 1 + 2 * held) << "each entry holds its object once";
    tree.removeAllObjects();
    EXPECT_EQ(value.use_count(), 1 + held);
  }
}

/// Runs `work` on a thread with little room for calls within calls.
void onASmallStack(void (*work)()) {
  pthread_attr_t attributes;
  pthread_attr_init(&attributes);
  pthread_attr_setstacksize(&attributes, 128u << 10);
  pthread_t thread{};
  ASSERT_EQ(pthread_create(
                &thread, &attributes,
                [](void* function) -> void* {
                  reinterpret_cast<void (*)()>(function)();
                  return nullptr;
                },
                reinterpret_cast<void*>(work)),
            0);
  pthread_join(thread, nullptr);
  pthread_attr_destroy(&attributes);
}

TEST(Critbit, TheDeepestTreesAreWalkedAndClearedInASmallStack) {
  onASmallStack([] {
    // Every key hangs below those that are shorter, on either side.
    constexpr std::size_t kLevels = 4'000;
    critbit_tree tree;
    int value = 0;
    std::string run;
    for (std::size_t level = 0; level < kLevels; ++level) {
      ASSERT_EQ(critbit_insert(&tree, run.c_str(), &value, true), 2);
      ASSERT_EQ(critbit_insert(&tree, (run + 'b').c_str(), &value, true), 2);
      run += 'a';
    }
    std::size_t visited = 0;
    critbit_allprefixed(
        &tree, "", [](const char*, void*, void* count) { ++*static_cast<std::size_t*>(count); }, &visited);
    EXPECT_EQ(visited, 2 * kLevels);
    critbit_clear(&tree);
    EXPECT_EQ(tree.count, 0u);
  });
}

}  // namespace
}  // namespace sable::test

#include "cache/critbit.h"

#include <gtest/gtest.h>

#include <map>
#include <random>
#include <string>
#include <vector>

namespace tavix {
namespace {

struct Item : RefCounted {
  explicit Item(int v, int* destroyed = nullptr) : value(v), destroyed(destroyed) {}
  ~Item() override {
    if (destroyed) ++*destroyed;
  }
  int value;
  int* destroyed;
};

TEST(CritbitTree, HoldsExactlyOneReferencePerStoredValue) {
  int destroyed = 0;
  {
    CritbitTree tree;
    Ref<Item> first = makeRef<Item>(1, &destroyed);
    tree.setObject(first, "key");
    EXPECT_EQ(first->refCount(), 2u);
    tree.setObject(first, "key");  // the same object again: nothing changes
    EXPECT_EQ(first->refCount(), 2u);

    Ref<Item> second = makeRef<Item>(2, &destroyed);
    tree.setObject(second, "key");
    EXPECT_EQ(first->refCount(), 1u);  // released once by the replace
    EXPECT_EQ(second->refCount(), 2u);
    EXPECT_EQ(tree.count(), 1u);

    Ref<RefCounted> fetched = tree.objectForKey("key");
    EXPECT_EQ(second->refCount(), 3u);

    tree.setObject(makeRef<Item>(3, &destroyed), "other");
    tree.setObject(makeRef<Item>(4, &destroyed), "gone");
    tree.removeObjectForKey("gone");
    EXPECT_EQ(destroyed, 1);
    EXPECT_EQ(tree.count(), 2u);
  }
  // The tree's tear-down released "other"; the locals released the rest.
  EXPECT_EQ(destroyed, 4);
}

// Random inserts and deletes against std::map: catches splice and delete faults that hand-picked
// keys miss.
TEST(CritbitTree, AgreesWithStdMapUnderRandomChurn) {
  std::mt19937 rng(42);
  std::uniform_int_distribution<int> len(0, 6);
  std::uniform_int_distribution<int> ch(0, 5);
  const char alphabet[] = {'a', 'b', 'c', '\x7F', '\x80', '\xFF'};
  CritbitTree tree;
  std::map<std::string, int> model;
  for (int i = 0; i < 4000; ++i) {
    std::string key;
    for (int n = len(rng); n > 0; --n) key.push_back(alphabet[ch(rng)]);
    if (rng() % 3 == 0) {
      tree.removeObjectForKey(key);
      model.erase(key);
    } else {
      tree.setObject(makeRef<Item>(i), key);
      model[key] = i;
    }
  }
  ASSERT_EQ(tree.count(), model.size());
  for (const auto& [key, value] : model) {
    Ref<RefCounted> got = tree.objectForKey(key);
    ASSERT_TRUE(got) << key;
    EXPECT_EQ(static_cast<Item*>(got.get())->value, value);
  }
  for (const std::string prefix : {"", "a", "ab", "\x80", "\xFF\xFF", "cab"}) {
    std::vector<std::string> expected;
    for (auto it = model.lower_bound(prefix); it != model.end() && it->first.compare(0, prefix.size(), prefix) == 0; ++it)
      expected.push_back(it->first);
    std::vector<std::string> found;
    tree.keysMatchingPrefix(prefix, [&](std::string_view key, bool*) { found.emplace_back(key); });
    EXPECT_EQ(found, expected) << prefix;
  }
}

}  // namespace
}  // namespace tavix

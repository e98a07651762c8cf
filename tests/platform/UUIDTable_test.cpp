// The flat UUID table against std::map, through random inserts, overwrites
// and removals, with a hash that piles keys into the last two and the first
// two home slots of any size of table, so that runs wrap around the end of
// the array and removals shift across it.
#include "platform/UUIDTable.h"

#include <gtest/gtest.h>

#include <map>
#include <random>

namespace platform {
namespace {

struct EndHomes {
  std::size_t operator()(const UUID& uuid) const {
    const std::size_t k = uuid.bytes()[0] % 4;
    return k < 2 ? ~std::size_t{0} - k : k - 2;  // the last two slots, then the first two
  }
};

template <class Hash>
void matchesAMapThroughRandomChanges(int operations, int keys) {
  std::mt19937 random(42);
  std::vector<UUID> pool;
  for (int i = 0; i < keys; ++i) pool.push_back(UUID::random());
  UUIDTable<int, Hash> table;
  std::map<UUID, int> expected;
  for (int step = 0; step < operations; ++step) {
    const UUID& key = pool[random() % pool.size()];
    if (random() % 3 == 0) {
      EXPECT_EQ(table.erase(key), expected.erase(key) == 1);
    } else {
      table.insertOrAssign(key, step);
      expected[key] = step;
    }
    ASSERT_EQ(table.size(), expected.size());
  }
  for (const UUID& key : pool) {
    auto found = expected.find(key);
    int* value = table.find(key);
    ASSERT_EQ(value != nullptr, found != expected.end());
    if (value) {
      EXPECT_EQ(*value, found->second);
    }
  }
  std::map<UUID, int> visited;
  table.forEach([&](const UUID& key, int value) { visited[key] = value; });
  EXPECT_EQ(visited, expected);
  // Emptied, it shrinks back and still works.
  for (const UUID& key : pool) table.erase(key);
  EXPECT_TRUE(table.empty());
  table.insertOrAssign(pool[0], 1);
  EXPECT_EQ(*table.find(pool[0]), 1);
}

TEST(UUIDTableTest, AgreesWithAMapUnderCollidingKeys) {
  matchesAMapThroughRandomChanges<EndHomes>(20000, 40);
}

TEST(UUIDTableTest, AgreesWithAMapThroughGrowthAndShrinking) {
  matchesAMapThroughRandomChanges<std::hash<UUID>>(200000, 5000);
}

}  // namespace
}  // namespace platform

// The caller-uid cache in front of the bus: one question per unique name, only answers kept,
// bounded, and nothing carried over to another bus.
#include "providers/sender_uid_cache.h"

#include <gtest/gtest.h>

#include <map>
#include <string>
#include <vector>

namespace _CorvaneLogManager {
namespace {

// A bus whose answers the test sets; it records every name asked about.
struct FakeBus {
  std::map<std::string, uid_t> owners;
  std::vector<std::string> asked;
  static bool Lookup(void* context, const char* name, uid_t* uid) {
    FakeBus* bus = static_cast<FakeBus*>(context);
    bus->asked.push_back(name);
    auto owner = bus->owners.find(name);
    if (owner == bus->owners.end()) return false;
    *uid = owner->second;
    return true;
  }
};

TEST(SenderUidCacheTest, AsksOncePerNameKeepsOnlyAnswersAndForgetsTheOldestFirst) {
  FakeBus bus;
  bus.owners = {{":1.1", 5000}, {":1.2", 0}, {":1.3", 200}, {"com.example.well", 0}};
  SenderUidCache cache(2);
  uid_t uid = 99;
  EXPECT_FALSE(cache.UidOf("com.example.well", FakeBus::Lookup, &bus, &uid));
  EXPECT_FALSE(cache.UidOf(nullptr, FakeBus::Lookup, &bus, &uid));
  EXPECT_TRUE(bus.asked.empty()) << "only unique names are asked about";

  for (int i = 0; i < 3; ++i) {
    ASSERT_TRUE(cache.UidOf(":1.1", FakeBus::Lookup, &bus, &uid));
    EXPECT_EQ(uid, 5000u);
  }
  EXPECT_EQ(bus.asked, std::vector<std::string>{":1.1"});

  // A name the bus cannot tell about (gone, or an error) is asked again next time.
  EXPECT_FALSE(cache.UidOf(":1.9", FakeBus::Lookup, &bus, &uid));
  bus.owners[":1.9"] = 7;
  ASSERT_TRUE(cache.UidOf(":1.9", FakeBus::Lookup, &bus, &uid));
  EXPECT_EQ(uid, 7u);
  EXPECT_EQ(cache.Size(), 2u);

  // Full: the oldest (:1.1) goes, the newer ones stay without a question.
  ASSERT_TRUE(cache.UidOf(":1.2", FakeBus::Lookup, &bus, &uid));
  EXPECT_EQ(uid, 0u);
  EXPECT_EQ(cache.Size(), 2u);
  bus.asked.clear();
  ASSERT_TRUE(cache.UidOf(":1.9", FakeBus::Lookup, &bus, &uid));
  ASSERT_TRUE(cache.UidOf(":1.2", FakeBus::Lookup, &bus, &uid));
  EXPECT_TRUE(bus.asked.empty());
  ASSERT_TRUE(cache.UidOf(":1.1", FakeBus::Lookup, &bus, &uid));
  EXPECT_EQ(bus.asked, std::vector<std::string>{":1.1"});

  // Another bus hands out the same names afresh: nothing kept for the first one answers there.
  FakeBus other;
  other.owners = {{":1.1", 300}};
  ASSERT_TRUE(cache.UidOf(":1.1", FakeBus::Lookup, &other, &uid));
  EXPECT_EQ(uid, 300u);
  EXPECT_FALSE(cache.UidOf(":1.2", FakeBus::Lookup, &other, &uid));
}

}  // namespace
}  // namespace _CorvaneLogManager

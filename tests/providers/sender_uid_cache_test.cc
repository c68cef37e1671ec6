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
  FakeBus bus{{{":1.1", 5000}, {":1.2", 0}, {"com.example.well", 0}}, {}};
  SenderUidCache cache(2);
  auto uidOf = [&](const char* name, FakeBus* on) {
    uid_t uid = 99;
    return cache.UidOf(name, FakeBus::Lookup, on, &uid) ? static_cast<long>(uid) : -1L;
  };
  EXPECT_EQ(uidOf("com.example.well", &bus), -1);
  EXPECT_EQ(uidOf(nullptr, &bus), -1);
  EXPECT_TRUE(bus.asked.empty()) << "only unique names are asked about";
  for (int i = 0; i < 3; ++i) EXPECT_EQ(uidOf(":1.1", &bus), 5000);
  EXPECT_EQ(bus.asked, std::vector<std::string>{":1.1"});
  // A name the bus cannot tell about (gone, or an error) is asked again next time.
  EXPECT_EQ(uidOf(":1.9", &bus), -1);
  bus.owners[":1.9"] = 7;
  EXPECT_EQ(uidOf(":1.9", &bus), 7);
  // Full: the oldest (:1.1) goes, the newer ones stay without a question.
  EXPECT_EQ(uidOf(":1.2", &bus), 0);
  EXPECT_EQ(cache.Size(), 2u);
  bus.asked.clear();
  EXPECT_EQ(uidOf(":1.9", &bus) + uidOf(":1.2", &bus) + uidOf(":1.1", &bus), 5007);
  EXPECT_EQ(bus.asked, std::vector<std::string>{":1.1"});
  // Another bus hands out the same names afresh: nothing kept for the first one answers there.
  FakeBus other{{{":1.1", 300}}, {}};
  EXPECT_EQ(uidOf(":1.1", &other), 300);
  EXPECT_EQ(uidOf(":1.2", &other), -1);
}

}  // namespace
}  // namespace _CorvaneLogManager

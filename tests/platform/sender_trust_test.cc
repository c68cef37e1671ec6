// Host signal listeners' sender check: which uids count, what the cache keeps and how far.
#include "platform/host/sender_trust.h"

#include <gtest/gtest.h>

#include <map>
#include <string>

namespace {

using logmgr_host::SenderTrust;

struct FakeBus {
  std::map<std::string, uid_t> uids;  // a name missing here has left the bus
  int asked = 0;
};

bool Lookup(void* context, const char* name, uid_t* uid) {
  auto* bus = static_cast<FakeBus*>(context);
  ++bus->asked;
  auto it = bus->uids.find(name);
  if (it == bus->uids.end()) return false;
  *uid = it->second;
  return true;
}

TEST(SenderTrustTest, TrustsRootOnlyAndAsksOncePerName) {
  EXPECT_TRUE(SenderTrust::TrustedUid(0));
  EXPECT_FALSE(SenderTrust::TrustedUid(65534));
  FakeBus bus;
  bus.uids = {{":1.1", 0}, {":1.2", 65534}};
  SenderTrust trust(8);
  for (int round = 0; round < 3; ++round) {
    EXPECT_TRUE(trust.IsTrusted(":1.1", Lookup, &bus));
    EXPECT_FALSE(trust.IsTrusted(":1.2", Lookup, &bus));
  }
  EXPECT_EQ(bus.asked, 2);

  // A sender the bus no longer knows is refused and asked about again, since only an answer
  // is worth keeping; no unique name (or none at all) is refused without asking.
  EXPECT_FALSE(trust.IsTrusted(":1.3", Lookup, &bus));
  EXPECT_FALSE(trust.IsTrusted(":1.3", Lookup, &bus));
  EXPECT_EQ(bus.asked, 4);
  bus.uids["com.corvane.logmgr"] = 0;
  EXPECT_FALSE(trust.IsTrusted("com.corvane.logmgr", Lookup, &bus));
  EXPECT_FALSE(trust.IsTrusted(nullptr, Lookup, &bus));
  EXPECT_EQ(bus.asked, 4);
}

TEST(SenderTrustTest, KeepsAtMostItsCapacityOldestOut) {
  FakeBus bus;
  SenderTrust trust(4);
  for (int i = 0; i < 5; ++i) bus.uids[":1." + std::to_string(i)] = 0;
  for (int i = 0; i < 5; ++i)
    EXPECT_TRUE(trust.IsTrusted((":1." + std::to_string(i)).c_str(), Lookup, &bus));
  EXPECT_EQ(bus.asked, 5);
  // The four latest are still known; the first was let go and costs a new question.
  for (int i = 1; i < 5; ++i)
    EXPECT_TRUE(trust.IsTrusted((":1." + std::to_string(i)).c_str(), Lookup, &bus));
  EXPECT_EQ(bus.asked, 5);
  EXPECT_TRUE(trust.IsTrusted(":1.0", Lookup, &bus));
  EXPECT_EQ(bus.asked, 6);
}

}  // namespace

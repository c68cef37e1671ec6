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

TEST(SenderTrustTest, TrustsRootOnlyAsksOncePerNameAndKeepsAtMostItsCapacity) {
  FakeBus bus;
  bus.uids = {{":1.1", 0}, {":1.2", 65534}, {"com.corvane.logmgr", 0}};
  SenderTrust trust(4);
  for (int round = 0; round < 3; ++round) {
    EXPECT_TRUE(trust.IsTrusted(":1.1", Lookup, &bus));
    EXPECT_FALSE(trust.IsTrusted(":1.2", Lookup, &bus));
  }
  EXPECT_EQ(bus.asked, 2);
  // A sender the bus no longer knows is refused and asked about again, since only an answer
  // is worth keeping; no unique name (or none at all) is refused without asking.
  EXPECT_FALSE(trust.IsTrusted(":1.3", Lookup, &bus));
  EXPECT_FALSE(trust.IsTrusted(":1.3", Lookup, &bus));
  EXPECT_FALSE(trust.IsTrusted("com.corvane.logmgr", Lookup, &bus));
  EXPECT_FALSE(trust.IsTrusted(nullptr, Lookup, &bus));
  EXPECT_EQ(bus.asked, 4);

  // Three more answers fill the four places; the oldest (:1.1) is let go and asked for again.
  for (int i = 4; i < 7; ++i) bus.uids[":1." + std::to_string(i)] = 0;
  for (int i = 4; i < 7; ++i)
    EXPECT_TRUE(trust.IsTrusted((":1." + std::to_string(i)).c_str(), Lookup, &bus));
  EXPECT_FALSE(trust.IsTrusted(":1.2", Lookup, &bus));
  EXPECT_EQ(bus.asked, 7);
  EXPECT_TRUE(trust.IsTrusted(":1.1", Lookup, &bus));
  EXPECT_EQ(bus.asked, 8);
}

}  // namespace

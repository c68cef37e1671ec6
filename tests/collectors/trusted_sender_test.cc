// The sender check behind every platform signal the daemon acts on, with the bus's answers
// played by a fake lookup that counts how often it is asked.
#include "collectors/trusted_sender.h"

#include <gtest/gtest.h>
#include <string.h>

#include <map>
#include <string>

namespace _CorvaneLogManager {
namespace {

std::map<std::string, uid_t> g_uids;  // a name missing here is one the bus cannot answer for
int g_asked = 0;

int FakeLookup(DBusConnection*, const char* sender, uid_t* uid) {
  ++g_asked;
  auto it = g_uids.find(sender);
  if (it == g_uids.end()) return -1;
  *uid = it->second;
  return 0;
}

class TrustedSenderTest : public ::testing::Test {
 protected:
  void SetUp() override {
    g_uids = {{":1.1", 0}, {":1.2", 65534}, {":1.3", 1000}};
    g_asked = 0;
    SetSenderUidLookup(FakeLookup);
  }
  void TearDown() override { SetSenderUidLookup(nullptr); }

  bool Trusted(const char* sender) {
    DBusMessage* msg = dbus_message_new_signal("/p", "org.example.i", "m");
    if (sender != nullptr) {
      EXPECT_TRUE(dbus_message_set_sender(msg, sender));
    }
    bool trusted = IsTrustedSender(nullptr, msg);
    dbus_message_unref(msg);
    return trusted;
  }
};

TEST_F(TrustedSenderTest, OnlyRootAndTheConfiguredUidsAreTrusted) {
  EXPECT_TRUE(Trusted(":1.1"));
  EXPECT_FALSE(Trusted(":1.2"));
  EXPECT_FALSE(Trusted(":1.3"));
  // No sender, a well-known name, or one the bus cannot place: refused without a guess.
  g_asked = 0;
  EXPECT_FALSE(Trusted(nullptr));
  EXPECT_FALSE(Trusted("org.tizen.system.deviced"));
  EXPECT_EQ(g_asked, 0);
  EXPECT_FALSE(Trusted(":1.99"));
  EXPECT_FALSE(IsTrustedSender(nullptr, nullptr));
}

TEST_F(TrustedSenderTest, AsksOncePerNameRetriesFailuresAndStaysBounded) {
  for (int i = 0; i < 3; ++i) {
    EXPECT_TRUE(Trusted(":1.1"));
    EXPECT_FALSE(Trusted(":1.2"));
  }
  EXPECT_EQ(g_asked, 2);
  // An unanswered lookup is not remembered: once the bus knows the name, it counts.
  EXPECT_FALSE(Trusted(":1.50"));
  g_uids[":1.50"] = 0;
  EXPECT_TRUE(Trusted(":1.50"));
  EXPECT_EQ(g_asked, 4);

  // Thousands of short-lived senders do not pile up: the oldest answers are given up and
  // asked for again, and still come out the same.
  for (int i = 0; i < 5000; ++i) {
    std::string name = ":2." + std::to_string(i);
    g_uids[name] = 65534;
    EXPECT_FALSE(Trusted(name.c_str()));
  }
  g_asked = 0;
  EXPECT_TRUE(Trusted(":1.1"));
  EXPECT_EQ(g_asked, 1);
}

}  // namespace
}  // namespace _CorvaneLogManager

// The sender check behind every platform signal the daemon acts on; a fake lookup plays the
// bus and counts how often it is asked.
#include "collectors/trusted_sender.h"

#include <gtest/gtest.h>

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

bool Trusted(const char* sender) {
  DBusMessage* msg = dbus_message_new_signal("/p", "org.example.i", "m");
  if (sender != nullptr) {
    EXPECT_TRUE(dbus_message_set_sender(msg, sender));
  }
  bool trusted = IsTrustedSender(nullptr, msg);
  dbus_message_unref(msg);
  return trusted;
}

TEST(TrustedSenderTest, OnlyRootIsTrustedAnswersAreKeptBoundedFailuresRetried) {
  g_uids = {{":1.1", 0}, {":1.2", 65534}, {":1.3", 1000}};
  g_asked = 0;
  SetSenderUidLookup(FakeLookup);
  // No sender or a well-known name: refused without a question to the bus.
  EXPECT_FALSE(Trusted(nullptr));
  EXPECT_FALSE(Trusted("org.tizen.system.deviced"));
  EXPECT_FALSE(IsTrustedSender(nullptr, nullptr));
  EXPECT_EQ(g_asked, 0);
  for (int i = 0; i < 3; ++i) {
    EXPECT_TRUE(Trusted(":1.1"));
    EXPECT_FALSE(Trusted(":1.2"));
    EXPECT_FALSE(Trusted(":1.3"));
  }
  EXPECT_EQ(g_asked, 3);
  // An unanswered lookup is not remembered: once the bus knows the name, it counts.
  EXPECT_FALSE(Trusted(":1.50"));
  g_uids[":1.50"] = 0;
  EXPECT_TRUE(Trusted(":1.50"));
  EXPECT_EQ(g_asked, 5);
  // Thousands of short-lived senders push the oldest answers out; asked again, they agree.
  for (int i = 0; i < 5000; ++i) {
    std::string name = ":2." + std::to_string(i);
    g_uids[name] = 65534;
    EXPECT_FALSE(Trusted(name.c_str()));
  }
  g_asked = 0;
  EXPECT_TRUE(Trusted(":1.1"));
  EXPECT_EQ(g_asked, 1);
  SetSenderUidLookup(nullptr);
}

}  // namespace
}  // namespace _CorvaneLogManager

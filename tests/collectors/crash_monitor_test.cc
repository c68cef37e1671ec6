// CrashMonitor's filter on hand-built signals against the real app and survey databases.
#include "collectors/crash_monitor.h"

#include "collectors/trusted_sender.h"
#include "tests/collectors/app_db_test_env.h"

namespace _CorvaneLogManager {
namespace {

// The crash service runs as root (:1.7), an app as nobody (:1.9); other names are unknown.
int FakeUidLookup(DBusConnection*, const char* sender, uid_t* uid) {
  bool root = strcmp(sender, ":1.7") == 0;
  if (!root && strcmp(sender, ":1.9") != 0) return -1;
  *uid = root ? 0 : 65534;
  return 0;
}

class CrashMonitorTest : public AppDbTest {
 protected:
  void SetUp() override {
    AppDbTest::SetUp();
    SetSenderUidLookup(FakeUidLookup);
  }
  void TearDown() override {
    SetSenderUidLookup(nullptr);
    AppDbTest::TearDown();
  }
  // Passes a signal through the filter, which must always leave it to the next filter.
  void Deliver(const char* member, const char* exe, const char* sender = ":1.7",
               bool intArg = false) {
    const char* iface = "org.tizen.system.crash.Crash";
    DBusMessage* msg = dbus_message_new_signal("/Org/Tizen/System/Crash/Crash", iface, member);
    ASSERT_NE(msg, nullptr);
    if (sender != nullptr) {
      ASSERT_TRUE(dbus_message_set_sender(msg, sender));
    }
    const char* name = "proc";
    dbus_int32_t number = 7;
    ASSERT_TRUE(intArg ? dbus_message_append_args(msg, DBUS_TYPE_STRING, &name, DBUS_TYPE_INT32,
                                                  &number, DBUS_TYPE_INVALID)
                       : dbus_message_append_args(msg, DBUS_TYPE_STRING, &name, DBUS_TYPE_STRING,
                                                  &exe, DBUS_TYPE_INVALID));
    EXPECT_EQ(CrashMonitor::CrashFilter(nullptr, msg, &monitor),
              DBUS_HANDLER_RESULT_NOT_YET_HANDLED);
    dbus_message_unref(msg);
  }
  std::string Errors() {
    return Rows("SELECT app_id, type FROM report_app_error_survey ORDER BY _id");
  }

  CrashMonitor monitor{ProviderRegistry::GetInstance()};
};

TEST_F(CrashMonitorTest, OnlyCrashesReportedByATrustedSenderAreWritten) {
  const char* exe = "/usr/apps/app/bin/app";
  Install("com.ex.app", "pkg.app", exe);
  for (const char* sender : {":1.9", ":1.404", "com.example.name", (const char*)nullptr}) {
    SCOPED_TRACE(sender != nullptr ? sender : "no sender");
    Deliver("ProcessCrashed", exe, sender);
  }
  Deliver("ProcessStarted", exe);
  Deliver("ProcessCrashed", exe, ":1.7", true);
  EXPECT_EQ(Errors(), "");
  Deliver("ProcessCrashed", exe);
  EXPECT_EQ(Errors(), "com.ex.app:1;");
  ASSERT_EQ(Sh("echo garbage > '" + sysroot + "/opt/dbspace/.pkgmgr_parser.db'"), 0);
  Deliver("ProcessCrashed", exe);
  EXPECT_EQ(Errors(), "com.ex.app:1;");
}

TEST_F(CrashMonitorTest, StoresAppIdsVerbatimAndRefusesOnesThatDoNotFit) {
  // "'id',1" fits the 512-byte text up to a 507-character id; a quote takes two bytes.
  const std::string quoted = "com.ex.o'x',9); DROP TABLE report_app_error_survey; --";
  const std::string fits(507, 'a'), tooLong(508, 'b'), quotedTooLong = std::string(506, 'c') + "'";
  for (const std::string& id : {quoted, fits, tooLong, quotedTooLong}) {
    SCOPED_TRACE(id.size());
    std::string exe = "/usr/apps/x" + std::to_string(id.size()) + id.substr(0, 1);
    Install(id, "pkg.x", exe);
    Deliver("ProcessCrashed", exe.c_str());
  }
  EXPECT_EQ(Errors(), quoted + ":1;" + fits + ":1;");
}

}  // namespace
}  // namespace _CorvaneLogManager

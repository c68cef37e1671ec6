// CrashMonitor's filter on hand-built signals against the real app and survey databases.
#include "collectors/crash_monitor.h"

#include "collectors/trusted_sender.h"
#include "tests/collectors/app_db_test_env.h"

namespace _CorvaneLogManager {
namespace {

// The crash service's sender, as root; untrusted senders are the sender check's own tests.
int FakeUidLookup(DBusConnection*, const char* sender, uid_t* uid) {
  *uid = 0;
  return strcmp(sender, ":1.7") == 0 ? 0 : -1;
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
  void Deliver(const char* interface, const char* member, int type1, const void* arg1,
               int type2 = DBUS_TYPE_INVALID, const void* arg2 = nullptr,
               const char* sender = ":1.7") {
    DBusMessage* msg = dbus_message_new_signal("/Org/Tizen/System/Crash/Crash", interface, member);
    ASSERT_NE(msg, nullptr);
    if (sender != nullptr) {
      ASSERT_TRUE(dbus_message_set_sender(msg, sender));
    }
    if (type1 != DBUS_TYPE_INVALID) {
      ASSERT_TRUE(dbus_message_append_args(msg, type1, arg1, type2, arg2, DBUS_TYPE_INVALID));
    }
    EXPECT_EQ(CrashMonitor::CrashFilter(nullptr, msg, &monitor),
              DBUS_HANDLER_RESULT_NOT_YET_HANDLED);
    dbus_message_unref(msg);
  }
  void Crash(const char* exe, const char* sender = ":1.7") {
    const char* name = "proc";
    Deliver(kIface, "ProcessCrashed", DBUS_TYPE_STRING, &name, DBUS_TYPE_STRING, &exe, sender);
  }
  std::string Errors() {
    return Rows("SELECT app_id, type FROM report_app_error_survey ORDER BY _id");
  }

  static constexpr const char* kIface = "org.tizen.system.crash.Crash";
  CrashMonitor monitor{ProviderRegistry::GetInstance()};
};

// Malformed signals and unknown executables also run through the daemon in the system tests.
TEST_F(CrashMonitorTest, IgnoresOtherSignalsAndUnreadableAppData) {
  Install("com.ex.app", "pkg.app", "/usr/apps/app/bin/app");
  const char* exe = "/usr/apps/app/bin/app";
  const char* name = "app";
  dbus_int32_t number = 7;
  Deliver(kIface, "ProcessStarted", DBUS_TYPE_STRING, &name, DBUS_TYPE_STRING, &exe);
  Deliver(kIface, "ProcessCrashed", DBUS_TYPE_STRING, &name, DBUS_TYPE_INT32, &number);
  ASSERT_EQ(Sh("echo garbage > '" + sysroot + "/opt/dbspace/.pkgmgr_parser.db'"), 0);
  Crash(exe);
  EXPECT_EQ(Errors(), "");
}

TEST_F(CrashMonitorTest, StoresAppIdsVerbatimAndRefusesOnesThatDoNotFit) {
  // "'id',1" fits the 512-byte text up to a 507-character id; a quote takes two bytes.
  const std::string quoted = "com.ex.o'x',9); DROP TABLE report_app_error_survey; --";
  const std::string fits(507, 'a'), tooLong(508, 'b'), quotedTooLong = std::string(506, 'c') + "'";
  for (const std::string& id : {quoted, fits, tooLong, quotedTooLong}) {
    SCOPED_TRACE(id.size());
    std::string exe = "/usr/apps/x" + std::to_string(id.size()) + id.substr(0, 1);
    Install(id, "pkg.x", exe);
    Crash(exe.c_str());
  }
  EXPECT_EQ(Errors(), quoted + ":1;" + fits + ":1;");
}

}  // namespace
}  // namespace _CorvaneLogManager

// CrashMonitor's filter on hand-built signals against the real app and survey databases.
#include "collectors/crash_monitor.h"

#include "app_db_test_env.h"

namespace _CorvaneLogManager {
namespace {

class CrashMonitorTest : public AppDbTest {
 protected:
  // Passes a signal through the filter, which must always leave it to the next filter.
  void Deliver(const char* interface, const char* member, int type1, const void* arg1,
               int type2 = DBUS_TYPE_INVALID, const void* arg2 = nullptr) {
    DBusMessage* msg = dbus_message_new_signal("/Org/Tizen/System/Crash/Crash", interface, member);
    ASSERT_NE(msg, nullptr);
    if (type1 != DBUS_TYPE_INVALID) {
      ASSERT_TRUE(dbus_message_append_args(msg, type1, arg1, type2, arg2, DBUS_TYPE_INVALID));
    }
    EXPECT_EQ(CrashMonitor::CrashFilter(nullptr, msg, &monitor),
              DBUS_HANDLER_RESULT_NOT_YET_HANDLED);
    dbus_message_unref(msg);
  }
  void Crash(const char* exe) {
    const char* name = "proc";
    Deliver(kIface, "ProcessCrashed", DBUS_TYPE_STRING, &name, DBUS_TYPE_STRING, &exe);
  }
  std::string Errors() {
    return Rows("SELECT app_id, type FROM report_app_error_survey ORDER BY _id");
  }

  static constexpr const char* kIface = "org.tizen.system.crash.Crash";
  CrashMonitor monitor;
};

TEST_F(CrashMonitorTest, WritesOneRowPerAppOfTheExecutable) {
  Install("com.ex.shared.one", "pkg.shared", "/usr/apps/shared/bin/shared");
  Install("com.ex.shared.two", "pkg.shared", "/usr/apps/shared/bin/shared");
  Install("com.ex.other", "pkg.other", "/usr/apps/other/bin/other");
  Crash("/usr/apps/shared/bin/shared");
  EXPECT_EQ(Errors(), "com.ex.shared.one:1;com.ex.shared.two:1;");
}

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

TEST_F(CrashMonitorTest, CutsALongAppIdToTheValuesBuffer) {
  // "'id',1" fits the 512-byte text up to a 507-character id; one more and the cut takes the
  // type, which leaves a statement the database refuses.
  for (size_t length : {507u, 508u}) {
    SCOPED_TRACE(length);
    std::string exe = "/usr/apps/long" + std::to_string(length);
    Install(std::string(length, 'a'), "pkg.long", exe);
    Crash(exe.c_str());
  }
  EXPECT_EQ(Errors(), std::string(507, 'a') + ":1;");
}

}  // namespace
}  // namespace _CorvaneLogManager

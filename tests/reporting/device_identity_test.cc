#include "reporting/device_identity.h"

#include <gtest/gtest.h>
#include <stdio.h>
#include <stdlib.h>
#include <system_info.h>

#include <memory>
#include <string>

#include "tests/temp_sysroot.h"

namespace _CorvaneLogManager {
namespace {

std::string SourceDir() {
  std::string file = __FILE__;  // <source>/tests/reporting/device_identity_test.cc
  return file.substr(0, file.rfind("/tests/"));
}

std::string Shell(const std::string& command) {
  std::string out;
  FILE* pipe = popen(command.c_str(), "r");
  if (pipe == nullptr) return out;
  char buf[512];
  while (fgets(buf, sizeof(buf), pipe) != nullptr) out += buf;
  if (pclose(pipe) != 0) out = "<failed>" + out;
  return out;
}

// One sysroot with a private bus and the oFono mock for the whole suite.
class DeviceIdentityTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    root.reset(new TempSysroot("identity"));
    std::string out = Shell(SourceDir() + "/scripts/host-env start " + root->path() +
                            " --no-x --mock 'ofono={\"MobileCountryCode\": \"450\", "
                            "\"MobileNetworkCode\": \"05\"}'");
    size_t at = out.find("DBUS_SYSTEM_BUS_ADDRESS=");
    ASSERT_NE(at, std::string::npos) << out;
    busAddress = out.substr(at + 24, out.find('\n', at) - at - 24);
    if (busAddress.size() > 1 && busAddress.front() == '\'') {
      busAddress = busAddress.substr(1, busAddress.size() - 2);
    }
  }
  static void TearDownTestSuite() {
    (void)Shell(SourceDir() + "/scripts/host-env stop " + root->path());
    root.reset();
  }

  void SetUp() override {
    setenv("LOGMGR_SYSROOT", root->path().c_str(), 1);
    setenv("DBUS_SYSTEM_BUS_ADDRESS", busAddress.c_str(), 1);
    ASSERT_TRUE(Write("/etc/os-release", "VERSION_ID=12\n"));
    ASSERT_TRUE(Write("/sys/class/dmi/id/product_name", "Board 7\n"));
    ASSERT_TRUE(root->MakeDir("/sys/firmware/devicetree/base"));
    (void)unlink(root->Path("/sys/firmware/devicetree/base/model").c_str());
  }
  void TearDown() override { unsetenv("LOGMGR_SYSROOT"); }

  bool Write(const std::string& path, const std::string& text) { return root->Write(path, text); }
  void Sim(const std::string& properties) {
    ASSERT_EQ(Shell("DBUS_SYSTEM_BUS_ADDRESS='" + busAddress +
                    "' gdbus call --system --dest "
                    "org.ofono --object-path /ril_0 --method org.freedesktop.DBus.Mock."
                    "UpdateProperties org.ofono.SimManager \"" +
                    properties + "\" 2>&1")
                  .find("<failed>"),
              std::string::npos);
  }

  static std::unique_ptr<TempSysroot> root;
  static std::string busAddress;
};
std::unique_ptr<TempSysroot> DeviceIdentityTest::root;
std::string DeviceIdentityTest::busAddress;

std::string Text(const char* value) { return value != nullptr ? value : "<absent>"; }

TEST_F(DeviceIdentityTest, OperatorCodesAreReadAtEveryRefresh) {
  struct Case {
    const char* properties;
    int result;
    const char* mcc;
    const char* mnc;
  } cases[] = {
      {"{'Present': <true>, 'MobileCountryCode': <'450'>, 'MobileNetworkCode': <'05'>}", 0, "450",
       "05"},
      {"{'MobileCountryCode': <'310'>, 'MobileNetworkCode': <'410'>}", 0, "310", "410"},
      {"{'MobileCountryCode': <'450'>, 'MobileNetworkCode': <'1'>}", -1, nullptr, nullptr},
      {"{'MobileCountryCode': <'3104'>, 'MobileNetworkCode': <'100'>}", -1, nullptr, nullptr},
      {"{'MobileCountryCode': <'262'>, 'MobileNetworkCode': <'01'>, 'Present': <false>}", -1,
       nullptr, nullptr},
  };
  DeviceIdentity identity;
  for (const Case& c : cases) {
    SCOPED_TRACE(c.properties);
    Sim(c.properties);
    EXPECT_EQ(identity.Refresh(), c.result);
    EXPECT_EQ(Text(identity.Mcc()), Text(c.mcc));
    EXPECT_EQ(Text(identity.Mnc()), Text(c.mnc));
    // Read once, kept for the life of the object.
    Write("/sys/class/dmi/id/product_name", "Board 8\n");
    EXPECT_EQ(Text(identity.Model()), "Board 7");
    EXPECT_EQ(Text(identity.Firmware()), "12");
  }
}

// Without telephony the firmware read decides only the first refresh.
TEST_F(DeviceIdentityTest, SystemInfoReadsTheSysrootFiles) {
  setenv("DBUS_SYSTEM_BUS_ADDRESS", "unix:path=/nonexistent/bus", 1);
  DeviceIdentity identity;
  EXPECT_EQ(identity.Refresh(), 0);
  EXPECT_EQ(identity.Mcc(), nullptr);
  EXPECT_EQ(identity.Refresh(), -1);

  struct Case {
    const char* osRelease;
    const char* deviceTreeModel;  // null: no such file
    const char* dmiName;          // null: no such file
    const char* build;            // null: failure
    const char* model;            // null: failure
  } cases[] = {
      {"VERSION_ID=12\nBUILD_ID=\"W2 \\\"K\\\"\"\n", "Watch R1\n", "Board 7\n", "W2 \"K\"",
       "Watch R1"},
      {"VERSION_ID='3.0'", nullptr, "Board 7", "3.0", "Board 7"},
      {"ID=debian\nVERSION_ID=\"12\"\n", nullptr, nullptr, "12", nullptr},
      {"", nullptr, "Board 7", nullptr, "Board 7"},
  };
  std::string base = root->Path("/sys/");
  for (const Case& c : cases) {
    SCOPED_TRACE(c.osRelease);
    Write("/etc/os-release", c.osRelease);
    (void)unlink((base + "firmware/devicetree/base/model").c_str());
    (void)unlink((base + "class/dmi/id/product_name").c_str());
    if (c.deviceTreeModel != nullptr) {
      Write("/sys/firmware/devicetree/base/model", std::string(c.deviceTreeModel) + '\0');
    }
    if (c.dmiName != nullptr) Write("/sys/class/dmi/id/product_name", c.dmiName);
    for (auto [key, expected] : {std::make_pair(SYSTEM_INFO_KEY_BUILD_STRING, c.build),
                                 std::make_pair(SYSTEM_INFO_KEY_MODEL, c.model)}) {
      char* value = nullptr;
      int result = system_info_get_value_string(key, &value);
      EXPECT_EQ(result == SYSTEM_INFO_ERROR_NONE, expected != nullptr);
      EXPECT_EQ(Text(value), Text(expected));
      free(value);
    }
    DeviceIdentity fresh;
    EXPECT_EQ(fresh.Refresh(), c.build != nullptr ? 0 : -1);
    EXPECT_EQ(Text(fresh.Firmware()), Text(c.build));
    EXPECT_EQ(Text(fresh.Model()), Text(c.model));
  }
}

}  // namespace
}  // namespace _CorvaneLogManager

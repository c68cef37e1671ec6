// Host battery level: which power supply is read and which contents are refused.
#include "device/battery.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <fstream>
#include <string>
#include <vector>

#include "tests/temp_sysroot.h"

namespace {

struct Supply {
  const char* name;
  const char* type;      // null: no type file
  const char* capacity;  // null: no capacity file
};

class BatteryTest : public ::testing::Test {
 protected:
  void Install(const std::vector<Supply>& supplies) {
    (void)system(("rm -rf '" + root + "/sys'").c_str());
    for (const Supply& s : supplies) {
      std::string dir = root + "/sys/class/power_supply/" + s.name;
      (void)system(("mkdir -p '" + dir + "'").c_str());
      if (s.type != nullptr) std::ofstream(dir + "/type") << s.type;
      if (s.capacity != nullptr) std::ofstream(dir + "/capacity") << s.capacity;
    }
  }
  TempSysroot tmp{"battery"};
  const std::string root = tmp.path();
};

TEST_F(BatteryTest, ReadsTheFirstBatteryAndRefusesBadContents) {
  const int kFailed = DEVICE_ERROR_OPERATION_FAILED;
  struct Case {
    const char* what;
    std::vector<Supply> supplies;
    int result;
    int percent;
  } cases[] = {
      {"no power supplies", {}, kFailed, -1},
      {"mains only", {{"ac", "Mains\n", "100\n"}}, kFailed, -1},
      {"mains first",
       {{"ac", "Mains", "100"}, {"bat", "Battery\n", "57\n"}},
       DEVICE_ERROR_NONE,
       57},
      {"first of two", {{"BAT1", "Battery", "90"}, {"BAT0", "Battery", "0"}}, DEVICE_ERROR_NONE, 0},
      {"full", {{"battery", "Battery\n", "100"}}, DEVICE_ERROR_NONE, 100},
      {"unreadable first decides", {{"a", "Battery", "x"}, {"b", "Battery", "50"}}, kFailed, -1},
      {"no type file", {{"battery", nullptr, "50"}}, kFailed, -1},
  };
  for (const char* bad :
       {"full\n", "40%\n", "", "101\n", "-3\n", static_cast<const char*>(nullptr)}) {
    SCOPED_TRACE(bad != nullptr ? bad : "no capacity file");
    Install({{"battery", "Battery\n", bad}});
    int percent = -1;
    EXPECT_EQ(device_battery_get_percent(&percent), kFailed);
    EXPECT_EQ(percent, -1);
  }
  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    Install(c.supplies);
    int percent = -1;
    EXPECT_EQ(device_battery_get_percent(&percent), c.result);
    EXPECT_EQ(percent, c.percent);
  }
  EXPECT_EQ(device_battery_get_percent(nullptr), DEVICE_ERROR_INVALID_PARAMETER);
}

}  // namespace

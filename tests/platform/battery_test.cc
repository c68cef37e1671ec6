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
  struct Case {
    const char* what;
    std::vector<Supply> supplies;
    int result;
    int percent;
  } cases[] = {
      {"no power supplies", {}, DEVICE_ERROR_OPERATION_FAILED, -1},
      {"mains only", {{"ac", "Mains\n", "100\n"}}, DEVICE_ERROR_OPERATION_FAILED, -1},
      {"mains before battery",
       {{"ac", "Mains\n", "100\n"}, {"battery", "Battery\n", "57\n"}},
       DEVICE_ERROR_NONE,
       57},
      {"first of two batteries",
       {{"BAT1", "Battery", "90"}, {"BAT0", "Battery", "12"}},
       DEVICE_ERROR_NONE,
       12},
      {"empty battery", {{"battery", "Battery\n", "0\n"}}, DEVICE_ERROR_NONE, 0},
      {"full", {{"battery", "Battery\n", "100"}}, DEVICE_ERROR_NONE, 100},
      {"text", {{"battery", "Battery\n", "full\n"}}, DEVICE_ERROR_OPERATION_FAILED, -1},
      {"number then text", {{"battery", "Battery\n", "40%\n"}}, DEVICE_ERROR_OPERATION_FAILED, -1},
      {"empty file", {{"battery", "Battery\n", ""}}, DEVICE_ERROR_OPERATION_FAILED, -1},
      {"above 100", {{"battery", "Battery\n", "101\n"}}, DEVICE_ERROR_OPERATION_FAILED, -1},
      {"negative", {{"battery", "Battery\n", "-3\n"}}, DEVICE_ERROR_OPERATION_FAILED, -1},
      {"no capacity", {{"battery", "Battery\n", nullptr}}, DEVICE_ERROR_OPERATION_FAILED, -1},
      {"unreadable first battery decides",
       {{"a", "Battery", "x"}, {"b", "Battery", "50"}},
       DEVICE_ERROR_OPERATION_FAILED,
       -1},
      {"no type file", {{"battery", nullptr, "50"}}, DEVICE_ERROR_OPERATION_FAILED, -1},
  };
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

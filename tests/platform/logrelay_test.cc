// Host log relay's outbox: never reached through a link, never anything but a plain file of
// its own (modes under any umask are checked through the daemon, in tests/system/test_files).
#include <corvane_log_relay.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <stdint.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>
#include <functional>
#include <sstream>
#include <string>

#include "tests/temp_sysroot.h"

namespace {

class LogRelayTest : public ::testing::Test {
 protected:
  int RegisterOne() {
    corvane_log_item_h item = nullptr;
    if (corvane_log_relay_mobile_create_log_item_handle(&item) != 0) return -100;
    int64_t ms = 1;
    (void)corvane_log_relay_mobile_set_log_item(item, CORVANE_LOG_ITEM_BODY, "b");
    (void)corvane_log_relay_mobile_set_log_item(item, CORVANE_LOG_ITEM_TIME, &ms);
    int rc = corvane_log_relay_mobile_register_log_item(item);
    (void)corvane_log_relay_mobile_free_log_item(item);
    return rc;
  }
  static std::string Read(const std::string& path) {
    std::stringstream text;
    text << std::ifstream(path).rdbuf();
    return text.str();
  }
  TempSysroot tmp_{"relay"};
  const std::string dir_ = tmp_.path() + "/opt/usr/data/log-relay";
  const std::string outbox_ = dir_ + "/outbox.jsonl";
};

TEST_F(LogRelayTest, RefusesLinksAndOddFilesWithoutTouchingTheirTargets) {
  const std::string target = tmp_.path() + "/target";
  std::ofstream(target) << "keep\n";
  ASSERT_EQ(system(("mkdir -p '" + dir_ + "'").c_str()), 0);
  const std::string elsewhere = tmp_.path() + "/elsewhere";
  ASSERT_EQ(mkdir(elsewhere.c_str(), 0700), 0);
  // Each way puts something in the outbox's place; the FIFO nobody reads is refused at once,
  // not waited on.
  const struct {
    const char* what;
    std::function<int()> make;
    std::string made;
  } ways[] = {
      {"link to another file", [&] { return symlink(target.c_str(), outbox_.c_str()); }, outbox_},
      {"hard link to another file", [&] { return link(target.c_str(), outbox_.c_str()); }, outbox_},
      {"FIFO", [&] { return mkfifo(outbox_.c_str(), 0600); }, outbox_},
      {"directory is a link",
       [&] { return rmdir(dir_.c_str()) || symlink(elsewhere.c_str(), dir_.c_str()); }, dir_},
  };
  for (const auto& way : ways) {
    SCOPED_TRACE(way.what);
    ASSERT_EQ(way.make(), 0);
    EXPECT_EQ(RegisterOne(), CORVANE_LOG_RELAY_ERROR_IO);
    EXPECT_EQ(Read(target), "keep\n");
    struct stat st;
    EXPECT_NE(stat((elsewhere + "/outbox.jsonl").c_str(), &st), 0);
    ASSERT_EQ(unlink(way.made.c_str()), 0);
  }
  // Control: with nothing in the way the record lands in a directory and file of our own.
  EXPECT_EQ(RegisterOne(), CORVANE_LOG_RELAY_ERROR_NONE);
  EXPECT_EQ(Read(outbox_), "{\"3\": 1, \"7\": \"b\"}\n");
  EXPECT_EQ(Read(target), "keep\n");
}

}  // namespace

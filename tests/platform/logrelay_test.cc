// Host log relay's outbox: never reached through a link, never anything but a plain file of
// its own (modes under any umask are checked through the daemon, in tests/system/test_files).
#include <corvane_log_relay.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <stdint.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>
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
  {
    SCOPED_TRACE("outbox is a link to another file");
    ASSERT_EQ(symlink(target.c_str(), outbox_.c_str()), 0);
    EXPECT_EQ(RegisterOne(), CORVANE_LOG_RELAY_ERROR_IO);
    EXPECT_EQ(Read(target), "keep\n");
    ASSERT_EQ(unlink(outbox_.c_str()), 0);
  }
  {
    SCOPED_TRACE("outbox is a hard link to another file");
    ASSERT_EQ(link(target.c_str(), outbox_.c_str()), 0);
    EXPECT_EQ(RegisterOne(), CORVANE_LOG_RELAY_ERROR_IO);
    EXPECT_EQ(Read(target), "keep\n");
    ASSERT_EQ(unlink(outbox_.c_str()), 0);
  }
  {
    SCOPED_TRACE("outbox is a FIFO nobody reads: refused at once, not waited on");
    ASSERT_EQ(mkfifo(outbox_.c_str(), 0600), 0);
    EXPECT_EQ(RegisterOne(), CORVANE_LOG_RELAY_ERROR_IO);
    ASSERT_EQ(unlink(outbox_.c_str()), 0);
  }
  {
    SCOPED_TRACE("the outbox directory is a link");
    const std::string elsewhere = tmp_.path() + "/elsewhere";
    ASSERT_EQ(mkdir(elsewhere.c_str(), 0700), 0);
    ASSERT_EQ(rmdir(dir_.c_str()), 0);
    ASSERT_EQ(symlink(elsewhere.c_str(), dir_.c_str()), 0);
    EXPECT_EQ(RegisterOne(), CORVANE_LOG_RELAY_ERROR_IO);
    struct stat st;
    EXPECT_NE(stat((elsewhere + "/outbox.jsonl").c_str(), &st), 0);
    ASSERT_EQ(unlink(dir_.c_str()), 0);
  }
  // Control: with nothing in the way the record lands in a directory and file of our own.
  EXPECT_EQ(RegisterOne(), CORVANE_LOG_RELAY_ERROR_NONE);
  EXPECT_EQ(Read(outbox_), "{\"3\": 1, \"7\": \"b\"}\n");
  EXPECT_EQ(Read(target), "keep\n");
}

}  // namespace

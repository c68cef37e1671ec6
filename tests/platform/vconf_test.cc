// Host vconf: the key-file format, the sysroot mapping and change notification on the loop.
#include <glib.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>
#include <vconf.h>

#include <fstream>
#include <string>
#include <utility>

#include "platform/host/vconf_store.h"
#include "tests/temp_sysroot.h"

namespace {

class VconfTest : public ::testing::Test {
 protected:
  void WriteRaw(const std::string& rel, const std::string& text) {
    std::string path = root_ + rel;
    vconf_store::MakeParentDirs(path);
    std::ofstream(path) << text;
  }
  TempSysroot tmp_{"vconf"};
  const std::string root_ = tmp_.path();
};

TEST_F(VconfTest, ParsesOnlyWellFormedLines) {
  const std::pair<const char*, int> good[] = {
      {"bool 1\n", VCONF_TYPE_BOOL},         {"bool 0", VCONF_TYPE_BOOL},
      {"int -42\n", VCONF_TYPE_INT},         {"double 2.5\n", VCONF_TYPE_DOUBLE},
      {"string a b c\n", VCONF_TYPE_STRING}, {"string \n", VCONF_TYPE_STRING}};
  for (auto [text, type] : good) {
    vconf_store::Value v;
    ASSERT_TRUE(vconf_store::Parse(text, strlen(text), &v)) << text;
    EXPECT_EQ(v.type, type) << text;
  }
  for (const char* bad : {"bool 2\n", "int 12x\n", "int 99999999999\n", "int  5\n", "double nope\n",
                          "float 1\n", "int\n", "", "string a\nstring b\n"}) {
    vconf_store::Value v;
    EXPECT_FALSE(vconf_store::Parse(bad, strlen(bad), &v)) << bad;
  }
}

TEST_F(VconfTest, RoundTripsEveryTypeUnderTheSysroot) {
  ASSERT_EQ(vconf_set_bool("db/setting/report_diagnostic_info", 1), 0);
  ASSERT_EQ(vconf_set_int("memory/pm/state", 3), 0);
  ASSERT_EQ(vconf_set_dbl("db/test/tiny", 5e-310), 0);  // subnormal: still reads back
  ASSERT_EQ(vconf_set_str("file/test/name", "hello world"), 0);
  int b = -1, i = -1;
  double d = 0;
  EXPECT_TRUE(vconf_get_bool("db/setting/report_diagnostic_info", &b) == 0 && b == 1);
  EXPECT_TRUE(vconf_get_dbl("db/test/tiny", &d) == 0 && d == 5e-310);
  char* s = vconf_get_str("file/test/name");
  EXPECT_STREQ(s, "hello world");
  free(s);
  // Files land where the device keeps them, beneath the sysroot.
  std::ifstream pm(root_ + "/var/run/memory/pm/state");
  std::string line;
  std::getline(pm, line);
  EXPECT_EQ(line, "int 3");

  // Wrong type, missing key, foreign prefix and escapes all fail without touching outputs.
  b = 7;
  EXPECT_EQ(vconf_get_bool("memory/pm/state", &b), -1);
  EXPECT_EQ(b, 7);
  EXPECT_EQ(vconf_get_int("memory/absent/key", &i), -1);
  EXPECT_EQ(vconf_set_int("other/key", 1), -1);
  EXPECT_EQ(vconf_set_int("db/../../../etc/x", 1), -1);
  EXPECT_EQ(vconf_set_str("db/test/newline", "a\nb"), -1);
  EXPECT_EQ(i, -1);
}

TEST_F(VconfTest, ReadsOnlyRegularKeyFilesAndNeverWaits) {
  ASSERT_EQ(vconf_set_int("memory/test/good", 7), 0);
  const std::string dir = root_ + "/var/run/memory/test/";
  // A FIFO without a writer would block a plain open for good.
  ASSERT_EQ(mkfifo((dir + "fifo").c_str(), 0644), 0);
  // The store only renames regular files into place, so a link is someone else's: refused.
  ASSERT_EQ(symlink((dir + "good").c_str(), (dir + "link").c_str()), 0);
  ASSERT_EQ(mkdir((dir + "dir").c_str(), 0755), 0);
  WriteRaw("/var/run/memory/test/huge", "string " + std::string(9000, 'x') + "\n");
  struct Case {
    const char* key;
    int result;
  } cases[] = {{"memory/test/fifo", VCONF_ERROR_FILE_OPEN},
               {"memory/test/link", VCONF_ERROR_FILE_OPEN},
               {"memory/test/dir", VCONF_ERROR_FILE_OPEN},
               {"memory/test/huge", VCONF_ERROR_WRONG_VALUE},
               {"memory/test/node", VCONF_ERROR_FILE_OPEN}};
  // A device node (a copy of /dev/zero's) needs root to make; elsewhere that case is left out.
  bool node = mknod((dir + "node").c_str(), S_IFCHR | 0644, makedev(1, 5)) == 0;
  for (const Case& c : cases) {
    if (!node && strcmp(c.key, "memory/test/node") == 0) continue;
    SCOPED_TRACE(c.key);
    vconf_store::Value v;
    EXPECT_EQ(vconf_store::Read(c.key, &v), c.result);
    int i = -1;
    EXPECT_EQ(vconf_get_int(c.key, &i), -1);
    EXPECT_EQ(i, -1);
  }
  int i = -1;
  EXPECT_EQ(vconf_get_int("memory/test/good", &i), 0);
  EXPECT_EQ(i, 7);
}

struct Seen {
  int calls = 0;
  int value = -1;
  std::string name;
  GMainLoop* loop = g_main_loop_new(nullptr, FALSE);
};

void OnChanged(keynode_t* node, void* data) {
  auto* seen = static_cast<Seen*>(data);
  ++seen->calls;
  seen->value = vconf_keynode_get_int(node);
  seen->name = vconf_keynode_get_name(node);
  g_main_loop_quit(seen->loop);
}

// Runs the default context until the callback quits it; bounded so a missing notification
// fails instead of hanging.
void RunUntilNotified(Seen* seen) {
  guint guard = g_timeout_add_seconds(
      10, [](gpointer loop) { return g_main_loop_quit(static_cast<GMainLoop*>(loop)), FALSE; },
      seen->loop);
  g_main_loop_run(seen->loop);
  g_source_remove(guard);
}

TEST_F(VconfTest, KeyFileChangesReachTheCallbackOnTheMainContext) {
  Seen seen;
  // A repeated registration is kept once: one call per change.
  for (int i = 0; i < 2; ++i)
    ASSERT_EQ(vconf_notify_key_changed("memory/sysman/earjack", OnChanged, &seen), 0);
  // The same value again still notifies; a plain rewrite by another tool does too.
  const std::pair<const char*, int> writes[] = {{nullptr, 1}, {nullptr, 1}, {"int 0\n", 0}};
  for (int n = 0; n < 3; ++n) {
    if (writes[n].first != nullptr) {
      WriteRaw("/var/run/memory/sysman/earjack", writes[n].first);
    } else {
      ASSERT_EQ(vconf_set_int("memory/sysman/earjack", writes[n].second), 0);
    }
    RunUntilNotified(&seen);
    EXPECT_EQ(seen.calls, n + 1);
    EXPECT_EQ(seen.value, writes[n].second);
  }
  EXPECT_EQ(seen.name, "memory/sysman/earjack");

  // Garbage is skipped; the next good value still arrives, and a sibling key does not count.
  WriteRaw("/var/run/memory/sysman/earjack", "int garbage\n");
  while (g_main_context_iteration(nullptr, FALSE)) {
  }
  EXPECT_EQ(seen.calls, 3);
  ASSERT_EQ(vconf_set_int("memory/sysman/usb_status", 2), 0);
  ASSERT_EQ(vconf_set_int("memory/sysman/earjack", 3), 0);
  RunUntilNotified(&seen);
  EXPECT_EQ(seen.calls, 4);
  EXPECT_EQ(seen.value, 3);

  EXPECT_EQ(vconf_ignore_key_changed("memory/sysman/earjack", OnChanged), 0);
  EXPECT_EQ(vconf_ignore_key_changed("memory/sysman/earjack", OnChanged), -1);
  g_main_loop_unref(seen.loop);
}

}  // namespace

// Host alarms fire on the GLib main context at their local time, then every interval.
#include <alarm.h>
#include <glib.h>
#include <gtest/gtest.h>
#include <sys/time.h>
#include <time.h>

#include <vector>

namespace {

// gettimeofday, not time(): time() reads the coarse clock, which may still show the last second.
time_t Now() {
  struct timeval tv;
  gettimeofday(&tv, nullptr);
  return tv.tv_sec;
}

struct Fired {
  std::vector<std::pair<alarm_id_t, time_t>> calls;
  GMainLoop* loop = g_main_loop_new(nullptr, FALSE);
};

int OnAlarm(alarm_id_t id, void* data) {
  auto* fired = static_cast<Fired*>(data);
  fired->calls.emplace_back(id, Now());
  if (fired->calls.size() >= 2) g_main_loop_quit(fired->loop);
  return 0;
}

TEST(AlarmTest, RepeatsAtItsIntervalAndStopsWhenRemoved) {
  Fired fired;
  alarm_id_t id = 0;
  time_t target = Now() + 1;
  struct tm tm;
  localtime_r(&target, &tm);
  alarm_entry_t* entry = alarmmgr_create_alarm();
  alarm_date_t date = {tm.tm_year + 1900, tm.tm_mon + 1, tm.tm_mday,
                       tm.tm_hour,        tm.tm_min,     tm.tm_sec};
  EXPECT_EQ(alarmmgr_set_repeat_mode(entry, ALARM_REPEAT_MODE_REPEAT, 0), ERR_ALARM_INVALID_REPEAT);
  ASSERT_EQ(alarmmgr_set_time(entry, date), 0);
  ASSERT_EQ(alarmmgr_set_repeat_mode(entry, ALARM_REPEAT_MODE_REPEAT, 1), 0);
  ASSERT_EQ(alarmmgr_set_type(entry, ALARM_TYPE_VOLATILE), 0);
  EXPECT_NE(alarmmgr_add_alarm_with_localtime(entry, nullptr, &id), 0);  // not initialised

  ASSERT_EQ(alarmmgr_init("com.corvane.test"), 0);
  ASSERT_EQ(alarmmgr_set_cb(OnAlarm, &fired), 0);
  ASSERT_EQ(alarmmgr_add_alarm_with_localtime(entry, nullptr, &id), 0);
  ASSERT_EQ(alarmmgr_free_alarm(entry), 0);  // the manager keeps its own copy

  // Bounded so that an alarm which never fires fails the test instead of hanging it.
  guint guard = g_timeout_add_seconds(
      10, [](gpointer loop) { return g_main_loop_quit(static_cast<GMainLoop*>(loop)), FALSE; },
      fired.loop);
  g_main_loop_run(fired.loop);
  g_source_remove(guard);

  ASSERT_EQ(fired.calls.size(), 2u);
  EXPECT_EQ(fired.calls[0].first, id);
  EXPECT_EQ(fired.calls[1].first, id);
  EXPECT_GE(fired.calls[0].second, target);  // not before its local time
  EXPECT_GE(fired.calls[1].second, fired.calls[0].second + 1);

  EXPECT_EQ(alarmmgr_remove_alarm(id), 0);
  EXPECT_EQ(alarmmgr_remove_alarm(id), ERR_ALARM_INVALID_ID);
  alarmmgr_fini();
  g_main_loop_unref(fired.loop);
}

}  // namespace

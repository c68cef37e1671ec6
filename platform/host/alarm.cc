// Alarms live in the process: each registered alarm is one GLib timeout aimed at its next
// wall-clock time. A repeating alarm re-aims after every expiry, skipping the times a wall-clock
// jump has already passed, so it never fires in a burst.
#include <alarm.h>
#include <glib.h>
#include <string.h>
#include <sys/time.h>

#include <map>
#include <string>

struct alarm_info_t {
  alarm_date_t start = {};
  alarm_repeat_mode_t mode = ALARM_REPEAT_MODE_ONCE;
  int interval = 0;
  int type = ALARM_TYPE_DEFAULT;
};

namespace {

struct Registered {
  alarm_info_t info;
  time_t next = 0;  // wall-clock seconds of the next expiry
  guint source = 0;
};

struct Manager {
  bool initialised = false;
  std::string appid;
  alarm_cb_t cb = nullptr;
  void* cb_data = nullptr;
  alarm_id_t last_id = 0;
  std::map<alarm_id_t, Registered> alarms;
};

Manager& TheManager() {
  static Manager* m = new Manager();  // used by callbacks until the process ends
  return *m;
}

gboolean OnExpiry(gpointer data);

void Arm(alarm_id_t id, Registered* r) {
  struct timeval now;
  gettimeofday(&now, nullptr);
  gint64 delay_ms = (static_cast<gint64>(r->next) - now.tv_sec) * 1000 - now.tv_usec / 1000;
  if (delay_ms < 0) delay_ms = 0;
  r->source = g_timeout_add_full(G_PRIORITY_DEFAULT, static_cast<guint>(delay_ms), OnExpiry,
                                 GINT_TO_POINTER(id), nullptr);
}

gboolean OnExpiry(gpointer data) {
  alarm_id_t id = GPOINTER_TO_INT(data);
  Manager& m = TheManager();
  auto it = m.alarms.find(id);
  if (it == m.alarms.end()) return G_SOURCE_REMOVE;
  Registered& r = it->second;
  r.source = 0;
  struct timeval now;
  gettimeofday(&now, nullptr);
  if (now.tv_sec < r.next) {  // the clock moved back or the timer ran early: aim again
    Arm(id, &r);
    return G_SOURCE_REMOVE;
  }
  bool repeat = r.info.mode == ALARM_REPEAT_MODE_REPEAT && r.info.interval > 0;
  if (repeat) {
    while (r.next <= now.tv_sec) r.next += r.info.interval;
    Arm(id, &r);
  } else {
    m.alarms.erase(it);
  }
  if (m.cb != nullptr) (void)m.cb(id, m.cb_data);  // may remove the alarm; nothing used after
  return G_SOURCE_REMOVE;
}

}  // namespace

extern "C" {

int alarmmgr_init(const char* appid) {
  if (appid == nullptr || appid[0] == '\0') return ERR_ALARM_INVALID_PARAM;
  Manager& m = TheManager();
  m.initialised = true;
  m.appid = appid;
  return ALARMMGR_RESULT_SUCCESS;
}

void alarmmgr_fini(void) {
  Manager& m = TheManager();
  for (auto& entry : m.alarms) {
    if (entry.second.source != 0) g_source_remove(entry.second.source);
  }
  m.alarms.clear();
  m.cb = nullptr;
  m.cb_data = nullptr;
  m.initialised = false;
}

int alarmmgr_set_cb(alarm_cb_t handler, void* user_param) {
  Manager& m = TheManager();
  if (!m.initialised) return ERR_ALARM_SYSTEM_FAIL;
  if (handler == nullptr) return ERR_ALARM_INVALID_PARAM;
  m.cb = handler;
  m.cb_data = user_param;
  return ALARMMGR_RESULT_SUCCESS;
}

alarm_entry_t* alarmmgr_create_alarm(void) { return new alarm_info_t(); }

int alarmmgr_free_alarm(alarm_entry_t* alarm) {
  if (alarm == nullptr) return ERR_ALARM_INVALID_PARAM;
  delete alarm;
  return ALARMMGR_RESULT_SUCCESS;
}

int alarmmgr_set_time(alarm_entry_t* alarm, alarm_date_t time) {
  if (alarm == nullptr) return ERR_ALARM_INVALID_PARAM;
  if (time.month < 0 || time.month > 12 || time.day < 0 || time.day > 31 || time.hour < 0 ||
      time.hour > 23 || time.min < 0 || time.min > 59 || time.sec < 0 || time.sec > 60) {
    return ERR_ALARM_INVALID_DATE;
  }
  alarm->start = time;
  return ALARMMGR_RESULT_SUCCESS;
}

int alarmmgr_get_time(const alarm_entry_t* alarm, alarm_date_t* time) {
  if (alarm == nullptr || time == nullptr) return ERR_ALARM_INVALID_PARAM;
  *time = alarm->start;
  return ALARMMGR_RESULT_SUCCESS;
}

int alarmmgr_set_repeat_mode(alarm_entry_t* alarm, alarm_repeat_mode_t repeat_mode,
                             int repeat_value) {
  if (alarm == nullptr) return ERR_ALARM_INVALID_PARAM;
  if (repeat_mode < ALARM_REPEAT_MODE_ONCE || repeat_mode >= ALARM_REPEAT_MODE_MAX ||
      (repeat_mode == ALARM_REPEAT_MODE_REPEAT && repeat_value <= 0)) {
    return ERR_ALARM_INVALID_REPEAT;
  }
  alarm->mode = repeat_mode;
  alarm->interval = repeat_value;
  return ALARMMGR_RESULT_SUCCESS;
}

int alarmmgr_get_repeat_mode(const alarm_entry_t* alarm, alarm_repeat_mode_t* repeat_mode,
                             int* repeat_value) {
  if (alarm == nullptr || repeat_mode == nullptr || repeat_value == nullptr) {
    return ERR_ALARM_INVALID_PARAM;
  }
  *repeat_mode = alarm->mode;
  *repeat_value = alarm->interval;
  return ALARMMGR_RESULT_SUCCESS;
}

int alarmmgr_set_type(alarm_entry_t* alarm, int alarm_type) {
  if (alarm == nullptr) return ERR_ALARM_INVALID_PARAM;
  if (alarm_type & ~(ALARM_TYPE_VOLATILE | ALARM_TYPE_NOLAUNCH)) return ERR_ALARM_INVALID_TYPE;
  alarm->type = alarm_type;
  return ALARMMGR_RESULT_SUCCESS;
}

int alarmmgr_get_type(const alarm_entry_t* alarm, int* alarm_type) {
  if (alarm == nullptr || alarm_type == nullptr) return ERR_ALARM_INVALID_PARAM;
  *alarm_type = alarm->type;
  return ALARMMGR_RESULT_SUCCESS;
}

int alarmmgr_add_alarm_with_localtime(alarm_entry_t* alarm, const char*, alarm_id_t* alarm_id) {
  Manager& m = TheManager();
  if (!m.initialised) return ERR_ALARM_SYSTEM_FAIL;
  if (alarm == nullptr || alarm_id == nullptr) return ERR_ALARM_INVALID_PARAM;
  struct tm tm;
  memset(&tm, 0, sizeof tm);
  tm.tm_year = alarm->start.year - 1900;
  tm.tm_mon = alarm->start.month - 1;
  tm.tm_mday = alarm->start.day;
  tm.tm_hour = alarm->start.hour;
  tm.tm_min = alarm->start.min;
  tm.tm_sec = alarm->start.sec;
  tm.tm_isdst = -1;
  time_t when = mktime(&tm);
  if (when == static_cast<time_t>(-1)) return ERR_ALARM_INVALID_TIME;
  alarm_id_t id = ++m.last_id;
  Registered& r = m.alarms[id];
  r.info = *alarm;
  r.next = when;
  Arm(id, &r);
  *alarm_id = id;
  return ALARMMGR_RESULT_SUCCESS;
}

int alarmmgr_remove_alarm(alarm_id_t alarm_id) {
  Manager& m = TheManager();
  auto it = m.alarms.find(alarm_id);
  if (it == m.alarms.end()) return ERR_ALARM_INVALID_ID;
  if (it->second.source != 0) g_source_remove(it->second.source);
  m.alarms.erase(it);
  return ALARMMGR_RESULT_SUCCESS;
}

}  // extern "C"

// Host alarm-manager: the repeating wake-up alarm, fired in process on the GLib main context.
#ifndef LOGMGR_HOST_ALARM_H_
#define LOGMGR_HOST_ALARM_H_

#include <time.h>

#ifdef __cplusplus
extern "C" {
#endif

typedef int alarm_id_t;
typedef int (*alarm_cb_t)(alarm_id_t alarm_id, void* user_param);
typedef struct alarm_info_t alarm_entry_t;
typedef struct {
  int year;   // full year
  int month;  // 1-12
  int day;    // 1-31
  int hour;
  int min;
  int sec;
} alarm_date_t;

typedef enum {
  ALARM_REPEAT_MODE_ONCE = 0,
  ALARM_REPEAT_MODE_REPEAT = 1,
  ALARM_REPEAT_MODE_WEEKLY = 2,
  ALARM_REPEAT_MODE_MONTHLY = 3,
  ALARM_REPEAT_MODE_ANNUALLY = 4,
  ALARM_REPEAT_MODE_MAX = 5
} alarm_repeat_mode_t;

typedef enum {
  ALARMMGR_RESULT_SUCCESS = 0,
  ERR_ALARM_SYSTEM_FAIL = -1,
  ERR_ALARM_NO_PERMISSION = -3,
  ERR_ALARM_INVALID_TYPE = -4,
  ERR_ALARM_NO_SERVICE_NAME = -5,
  ERR_ALARM_INVALID_DATE = -6,
  ERR_ALARM_INVALID_TIME = -7,
  ERR_ALARM_INVALID_REPEAT = -8,
  ERR_ALARM_INVALID_ID = -9,
  ERR_ALARM_INVALID_PARAM = -10
} alarm_error_t;

#define ALARM_TYPE_DEFAULT 0x0
#define ALARM_TYPE_VOLATILE 0x02
#define ALARM_TYPE_NOLAUNCH 0x04

int alarmmgr_init(const char* appid);
void alarmmgr_fini(void);
int alarmmgr_set_cb(alarm_cb_t handler, void* user_param);
alarm_entry_t* alarmmgr_create_alarm(void);
int alarmmgr_free_alarm(alarm_entry_t* alarm);
int alarmmgr_set_time(alarm_entry_t* alarm, alarm_date_t time);
int alarmmgr_get_time(const alarm_entry_t* alarm, alarm_date_t* time);
int alarmmgr_set_repeat_mode(alarm_entry_t* alarm, alarm_repeat_mode_t repeat_mode,
                             int repeat_value);
int alarmmgr_get_repeat_mode(const alarm_entry_t* alarm, alarm_repeat_mode_t* repeat_mode,
                             int* repeat_value);
int alarmmgr_set_type(alarm_entry_t* alarm, int alarm_type);
int alarmmgr_get_type(const alarm_entry_t* alarm, int* alarm_type);
int alarmmgr_add_alarm_with_localtime(alarm_entry_t* alarm, const char* destination,
                                      alarm_id_t* alarm_id);
int alarmmgr_remove_alarm(alarm_id_t alarm_id);

#ifdef __cplusplus
}
#endif

#endif  // LOGMGR_HOST_ALARM_H_

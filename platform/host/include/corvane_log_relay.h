// The device maker's log-relay library: a handle collects the items of one log record and
// register queues the record for transfer off the device. Every call returns 0 on success.
#ifndef LOGMGR_HOST_CORVANE_LOG_RELAY_H_
#define LOGMGR_HOST_CORVANE_LOG_RELAY_H_

#ifdef __cplusplus
extern "C" {
#endif

typedef struct corvane_log_item* corvane_log_item_h;

// Item numbers of set_log_item. Every item is a NUL-terminated text except
// CORVANE_LOG_ITEM_TIME, which is a pointer to a signed 64-bit count of milliseconds.
enum {
  CORVANE_LOG_ITEM_LOG_TYPE = 1,
  CORVANE_LOG_ITEM_SVC_CODE = 2,
  CORVANE_LOG_ITEM_TIME = 3,
  CORVANE_LOG_ITEM_ACTIVITY = 4,
  CORVANE_LOG_ITEM_CATEGORY = 5,
  CORVANE_LOG_ITEM_APP_VERSION = 6,
  CORVANE_LOG_ITEM_BODY = 7,
  CORVANE_LOG_ITEM_APP_ID = 8
};

#define CORVANE_LOG_RELAY_ERROR_NONE 0
#define CORVANE_LOG_RELAY_ERROR_INVALID_PARAMETER (-22)
#define CORVANE_LOG_RELAY_ERROR_OUT_OF_MEMORY (-12)
#define CORVANE_LOG_RELAY_ERROR_IO (-5)

int corvane_log_relay_mobile_create_log_item_handle(corvane_log_item_h* handle);
// Setting an item again replaces its value.
int corvane_log_relay_mobile_set_log_item(corvane_log_item_h handle, int item, const void* value);
// Appends the record to the outbox; the handle stays valid and must still be freed.
int corvane_log_relay_mobile_register_log_item(corvane_log_item_h handle);
int corvane_log_relay_mobile_free_log_item(corvane_log_item_h handle);

#ifdef __cplusplus
}
#endif

#endif  // LOGMGR_HOST_CORVANE_LOG_RELAY_H_

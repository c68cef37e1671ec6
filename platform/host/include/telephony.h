// Host capi-telephony: the SIM operator of the first oFono modem on the system bus.
#ifndef LOGMGR_HOST_TELEPHONY_H_
#define LOGMGR_HOST_TELEPHONY_H_

#ifdef __cplusplus
extern "C" {
#endif

#define TELEPHONY_ERROR_NONE 0
#define TELEPHONY_ERROR_OUT_OF_MEMORY (-12)
#define TELEPHONY_ERROR_INVALID_PARAMETER (-22)
#define TELEPHONY_ERROR_PERMISSION_DENIED (-13)
#define TELEPHONY_ERROR_NOT_SUPPORTED (-1073741822)
#define TELEPHONY_ERROR_OPERATION_FAILED (-0x02600000 | 0x0001)
#define TELEPHONY_ERROR_SIM_NOT_AVAILABLE (-0x02600000 | 0x1001)

typedef enum {
  TELEPHONY_SIM_STATE_UNAVAILABLE = 0,
  TELEPHONY_SIM_STATE_LOCKED = 1,
  TELEPHONY_SIM_STATE_AVAILABLE = 2,
  TELEPHONY_SIM_STATE_UNKNOWN = 3
} telephony_sim_state_e;

typedef struct telephony_data* telephony_h;
typedef struct {
  unsigned int count;
  telephony_h* handle;  // handle[0] is the primary SIM
} telephony_handle_list_s;

// One handle per modem, in the order oFono lists them; no modem is a failure.
int telephony_init(telephony_handle_list_s* list);
int telephony_deinit(telephony_handle_list_s* list);
// MCC followed by MNC; the caller frees the text. No SIM present is
// TELEPHONY_ERROR_SIM_NOT_AVAILABLE.
int telephony_sim_get_operator(telephony_h handle, char** sim_operator);
int telephony_sim_get_state(telephony_h handle, telephony_sim_state_e* sim_state);

#ifdef __cplusplus
}
#endif

#endif  // LOGMGR_HOST_TELEPHONY_H_

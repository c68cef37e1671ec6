// Host vconf: the device's key-value settings, one file per key beneath the sysroot.
#ifndef LOGMGR_HOST_VCONF_H_
#define LOGMGR_HOST_VCONF_H_

#ifdef __cplusplus
extern "C" {
#endif

#define VCONF_OK 0
#define VCONF_ERROR -1
#define VCONF_ERROR_WRONG_PREFIX -2
#define VCONF_ERROR_WRONG_TYPE -3
#define VCONF_ERROR_WRONG_VALUE -4
#define VCONF_ERROR_NOT_INITIALIZED -5
#define VCONF_ERROR_NO_MEM -6
#define VCONF_ERROR_FILE_PERM -11
#define VCONF_ERROR_FILE_NO_ENT -14
#define VCONF_ERROR_FILE_OPEN -21
#define VCONF_ERROR_FILE_WRITE -24

enum {
  VCONF_TYPE_NONE = 0,
  VCONF_TYPE_STRING = 40,
  VCONF_TYPE_INT = 41,
  VCONF_TYPE_DOUBLE = 42,
  VCONF_TYPE_BOOL = 43,
  VCONF_TYPE_DIR = 44
};

typedef struct _keynode_t {
  char* keyname;
  int type;
  union {
    int i;
    int b;
    double d;
    char* s;
  } value;
  struct _keynode_t* next;
} keynode_t;

typedef void (*vconf_callback_fn)(keynode_t* node, void* user_data);

int vconf_set_int(const char* in_key, const int intval);
int vconf_set_bool(const char* in_key, const int boolval);
int vconf_set_dbl(const char* in_key, const double dblval);
int vconf_set_str(const char* in_key, const char* strval);
int vconf_get_int(const char* in_key, int* intval);
int vconf_get_bool(const char* in_key, int* boolval);
int vconf_get_dbl(const char* in_key, double* dblval);
char* vconf_get_str(const char* in_key);  // malloc'd; the caller frees it
int vconf_unset(const char* in_key);

// Callbacks run on the GLib default main context. Every set notifies, changed or not.
int vconf_notify_key_changed(const char* in_key, vconf_callback_fn cb, void* user_data);
int vconf_ignore_key_changed(const char* in_key, vconf_callback_fn cb);

char* vconf_keynode_get_name(keynode_t* keynode);
int vconf_keynode_get_type(keynode_t* keynode);
int vconf_keynode_get_int(keynode_t* keynode);
double vconf_keynode_get_dbl(keynode_t* keynode);
int vconf_keynode_get_bool(keynode_t* keynode);
char* vconf_keynode_get_str(keynode_t* keynode);  // points into the node

#ifdef __cplusplus
}
#endif

#endif  // LOGMGR_HOST_VCONF_H_

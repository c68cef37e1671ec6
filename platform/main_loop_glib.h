// Makes the Ecore main loop drive the GLib default main context.
#ifndef LOGMGR_PLATFORM_MAIN_LOOP_GLIB_H_
#define LOGMGR_PLATFORM_MAIN_LOOP_GLIB_H_

#ifdef __cplusplus
extern "C" {
#endif

// Call right after ecore_init(). Returns 1 on success, 0 on failure (Ecore's boolean).
int logmgr_main_loop_glib_integrate(void);

#ifdef __cplusplus
}
#endif

#endif  // LOGMGR_PLATFORM_MAIN_LOOP_GLIB_H_

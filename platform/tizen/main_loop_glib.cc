#include "platform/main_loop_glib.h"

#include <Ecore.h>

int logmgr_main_loop_glib_integrate(void) { return ecore_main_loop_glib_integrate(); }

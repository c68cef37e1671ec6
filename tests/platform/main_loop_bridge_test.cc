// The Ecore loop must drive the GLib default context: a libdbus filter set up on it and a
// GLib timeout both fire under ecore_main_loop_begin.
#include <Ecore.h>
#include <dbus/dbus-glib-lowlevel.h>
#include <dbus/dbus.h>
#include <glib.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <string>

#include "platform/main_loop_glib.h"

namespace {

struct Fired {
  bool filter = false;
  bool timeout = false;
};

Fired g_fired;

void QuitIfDone() {
  if (g_fired.filter && g_fired.timeout) ecore_main_loop_quit();
}

DBusHandlerResult OnSignal(DBusConnection*, DBusMessage* msg, void*) {
  if (dbus_message_is_signal(msg, "com.corvane.test", "Ping")) {
    g_fired.filter = true;
    QuitIfDone();
  }
  return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
}

gboolean OnGlibTimeout(gpointer) {
  g_fired.timeout = true;
  QuitIfDone();
  return G_SOURCE_REMOVE;
}

Eina_Bool SendPing(void* data) {
  auto* sender = static_cast<DBusConnection*>(data);
  DBusMessage* msg = dbus_message_new_signal("/com/corvane/test", "com.corvane.test", "Ping");
  dbus_connection_send(sender, msg, nullptr);
  dbus_connection_flush(sender);
  dbus_message_unref(msg);
  return ECORE_CALLBACK_CANCEL;
}

Eina_Bool GiveUp(void*) {
  ecore_main_loop_quit();
  return ECORE_CALLBACK_CANCEL;
}

TEST(MainLoopBridgeTest, DbusFilterAndGlibTimeoutFireUnderEcore) {
  // A private bus of our own, so the test needs nothing of the machine.
  FILE* p = popen("dbus-daemon --session --fork --print-address=1 --print-pid=1", "r");
  ASSERT_NE(p, nullptr);
  char address[512] = {0};
  long pid = 0;
  ASSERT_NE(fgets(address, sizeof address, p), nullptr);
  ASSERT_EQ(fscanf(p, "%ld", &pid), 1);
  pclose(p);
  address[strcspn(address, "\n")] = '\0';

  DBusError err;
  dbus_error_init(&err);
  DBusConnection* listener = dbus_connection_open_private(address, &err);
  ASSERT_NE(listener, nullptr) << err.message;
  ASSERT_TRUE(dbus_bus_register(listener, &err));
  DBusConnection* sender = dbus_connection_open_private(address, &err);
  ASSERT_NE(sender, nullptr);
  ASSERT_TRUE(dbus_bus_register(sender, &err));

  ASSERT_NE(ecore_init(), 0);
  ASSERT_EQ(logmgr_main_loop_glib_integrate(), 1);
  dbus_connection_setup_with_g_main(listener, nullptr);
  dbus_bus_add_match(listener, "type='signal',interface='com.corvane.test'", &err);
  ASSERT_FALSE(dbus_error_is_set(&err));
  ASSERT_TRUE(dbus_connection_add_filter(listener, OnSignal, nullptr, nullptr));
  g_timeout_add(10, OnGlibTimeout, nullptr);
  ecore_timer_add(0.05, SendPing, sender);
  Ecore_Timer* guard = ecore_timer_add(20.0, GiveUp, nullptr);

  ecore_main_loop_begin();
  ecore_timer_del(guard);

  EXPECT_TRUE(g_fired.filter);
  EXPECT_TRUE(g_fired.timeout);

  dbus_connection_close(listener);
  dbus_connection_unref(listener);
  dbus_connection_close(sender);
  dbus_connection_unref(sender);
  ecore_shutdown();
  kill(static_cast<pid_t>(pid), SIGTERM);
}

}  // namespace

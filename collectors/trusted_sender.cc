#include "collectors/trusted_sender.h"

#include <stddef.h>

#include <string>
#include <unordered_map>

namespace _CorvaneLogManager {

namespace {

const uid_t kTrustedUids[] = {LOGMGR_SIGNAL_SENDER_UIDS};

// Senders come and go (every devsim run is a new one); a full cache starts over rather than
// grow with them.
const size_t kMaxKnownSenders = 64;

// The bus answers at once from its own tables; the bound only matters if the bus itself
// stalls. libdbus's default (25 s), as for the daemon's other bus calls: a sped-up test clock
// shrinks it by its factor (x4320: 6 ms), and shorter bounds then dropped platform signals.
const int kLookupTimeoutMs = DBUS_TIMEOUT_USE_DEFAULT;

int AskBus(DBusConnection* connection, const char* sender, uid_t* uid) {
  if (connection == nullptr) return -1;
  DBusMessage* call = dbus_message_new_method_call("org.freedesktop.DBus", "/org/freedesktop/DBus",
                                                   "org.freedesktop.DBus", "GetConnectionUnixUser");
  if (call == nullptr) return -1;
  if (!dbus_message_append_args(call, DBUS_TYPE_STRING, &sender, DBUS_TYPE_INVALID)) {
    dbus_message_unref(call);
    return -1;
  }
  DBusError error;
  dbus_error_init(&error);
  DBusMessage* reply =
      dbus_connection_send_with_reply_and_block(connection, call, kLookupTimeoutMs, &error);
  dbus_message_unref(call);
  if (reply == nullptr) {
    dbus_error_free(&error);
    return -1;
  }
  dbus_uint32_t user = 0;
  bool read = dbus_message_get_args(reply, &error, DBUS_TYPE_UINT32, &user, DBUS_TYPE_INVALID);
  dbus_message_unref(reply);
  if (!read) {
    dbus_error_free(&error);
    return -1;
  }
  *uid = static_cast<uid_t>(user);
  return 0;
}

SenderUidLookup g_lookup = AskBus;
std::unordered_map<std::string, uid_t> g_known;

bool IsTrustedUid(uid_t uid) {
  if (uid == 0) return true;
  for (uid_t trusted : kTrustedUids)
    if (uid == trusted) return true;
  return false;
}

}  // namespace

bool IsTrustedSender(DBusConnection* connection, DBusMessage* message) {
  const char* sender = message != nullptr ? dbus_message_get_sender(message) : nullptr;
  // Only a unique name identifies one connection; anything else cannot be asked about.
  if (sender == nullptr || sender[0] != ':') return false;
  auto known = g_known.find(sender);
  if (known != g_known.end()) return IsTrustedUid(known->second);
  uid_t uid = 0;
  // A failed lookup is not kept: the next signal of that sender asks again.
  if (g_lookup(connection, sender, &uid) != 0) return false;
  if (g_known.size() >= kMaxKnownSenders) g_known.clear();
  g_known.emplace(sender, uid);
  return IsTrustedUid(uid);
}

void SetSenderUidLookup(SenderUidLookup lookup) {
  g_lookup = lookup != nullptr ? lookup : AskBus;
  g_known.clear();
}

}  // namespace _CorvaneLogManager

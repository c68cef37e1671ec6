#include "platform/host/sender_trust.h"

#include <string.h>

namespace logmgr_host {

namespace {

// Enough for every platform service at once; a flood of one-shot senders only costs lookups.
constexpr size_t kProcessCacheSize = 64;

const uid_t kTrustedUids[] = {LOGMGR_SIGNAL_SENDER_UIDS};

bool BusUidOf(void* context, const char* uniqueName, uid_t* uid) {
  DBusError err;
  dbus_error_init(&err);
  unsigned long owner =
      dbus_bus_get_unix_user(static_cast<DBusConnection*>(context), uniqueName, &err);
  if (dbus_error_is_set(&err)) {
    dbus_error_free(&err);
    return false;
  }
  if (owner == static_cast<unsigned long>(-1)) return false;
  *uid = static_cast<uid_t>(owner);
  return true;
}

}  // namespace

bool SenderTrust::TrustedUid(uid_t uid) {
  if (uid == 0) return true;
  for (uid_t trusted : kTrustedUids) {
    if (uid == trusted) return true;
  }
  return false;
}

bool SenderTrust::IsTrusted(const char* sender, UidLookup lookup, void* context) {
  // Only a unique name identifies a connection; a message without one came from no bus peer.
  if (sender == nullptr || sender[0] != ':' || lookup == nullptr) return false;
  auto it = verdicts.find(sender);
  if (it != verdicts.end()) return it->second;
  uid_t uid = 0;
  if (!lookup(context, sender, &uid)) return false;
  bool trusted = TrustedUid(uid);
  if (capacity == 0) return trusted;
  if (order.size() >= capacity) {
    verdicts.erase(order.front());
    order.pop_front();
  }
  order.emplace_back(sender);
  verdicts.emplace(sender, trusted);
  return trusted;
}

bool SignalSenderTrusted(DBusConnection* connection, DBusMessage* message) {
  static SenderTrust* cache = new SenderTrust(kProcessCacheSize);  // for the process's life
  if (connection == nullptr || message == nullptr) return false;
  return cache->IsTrusted(dbus_message_get_sender(message), BusUidOf, connection);
}

}  // namespace logmgr_host

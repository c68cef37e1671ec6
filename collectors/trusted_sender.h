// Whether a platform signal comes from a process allowed to steer the daemon: root, or a uid
// the platform's own sending services run as (LOGMGR_SIGNAL_SENDER_UIDS, set by the build).
#ifndef LOGMGR_COLLECTORS_TRUSTED_SENDER_H_
#define LOGMGR_COLLECTORS_TRUSTED_SENDER_H_

#include <dbus/dbus.h>
#include <sys/types.h>

namespace _CorvaneLogManager {

// True when |message| names a sender whose uid is trusted. The bus is asked once per unique
// name and the answer kept: the bus never hands a unique name to a second connection.
bool IsTrustedSender(DBusConnection* connection, DBusMessage* message);

// Finds the uid behind a unique bus name: 0 with |*uid| set, or -1.
using SenderUidLookup = int (*)(DBusConnection* connection, const char* sender, uid_t* uid);
// Replaces how uids are found (null: ask the bus) and forgets every kept answer.
void SetSenderUidLookup(SenderUidLookup lookup);

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_COLLECTORS_TRUSTED_SENDER_H_

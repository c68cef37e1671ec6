// Which senders may steer the host platform's signal listeners (aul, pkgmgr): root and the uids
// the build trusts (LOGMGR_SIGNAL_SENDER_UIDS). A sender's uid is asked of the bus once per
// unique name and kept, since the bus never hands a unique name out twice.
#ifndef LOGMGR_HOST_SENDER_TRUST_H_
#define LOGMGR_HOST_SENDER_TRUST_H_

#include <dbus/dbus.h>
#include <stddef.h>
#include <sys/types.h>

#include <deque>
#include <string>
#include <unordered_map>

namespace logmgr_host {

class SenderTrust {
 public:
  // Fills |uid| with the owner of |uniqueName|; false when the bus cannot tell (gone, error).
  using UidLookup = bool (*)(void* context, const char* uniqueName, uid_t* uid);

  explicit SenderTrust(size_t capacity) : capacity(capacity) {}

  // Whether |sender| runs as a trusted uid. Only answers the bus gave are kept: a sender that
  // already left cannot send again, and a passing bus error must not stick to a live name.
  bool IsTrusted(const char* sender, UidLookup lookup, void* context);

  static bool TrustedUid(uid_t uid);

 private:
  size_t capacity;
  std::unordered_map<std::string, bool> verdicts;
  std::deque<std::string> order;  // oldest first, for eviction
};

// The check the listeners run on a received signal, with one cache for the process. It asks
// the bus synchronously on |connection|, so a sender must stay connected until its signal is
// handled (a platform service does; a one-shot tool pings the receiver before it leaves).
bool SignalSenderTrusted(DBusConnection* connection, DBusMessage* message);

}  // namespace logmgr_host

#endif  // LOGMGR_HOST_SENDER_TRUST_H_

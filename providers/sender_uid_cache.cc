#include "providers/sender_uid_cache.h"

namespace _CorvaneLogManager {

bool SenderUidCache::UidOf(const char* sender, Lookup lookup, void* context, uid_t* uid) {
  // Only a unique name identifies one connection; a well-known name can change hands.
  if (sender == nullptr || sender[0] != ':' || lookup == nullptr || uid == nullptr) return false;
  if (context != bus) {
    Clear();
    bus = context;
  }
  auto known = uids.find(sender);
  if (known != uids.end()) {
    *uid = known->second;
    return true;
  }
  uid_t found = 0;
  if (!lookup(context, sender, &found)) return false;
  *uid = found;
  if (capacity == 0) return true;
  if (order.size() >= capacity) {
    uids.erase(order.front());
    order.pop_front();
  }
  order.emplace_back(sender);
  uids.emplace(sender, found);
  return true;
}

void SenderUidCache::Clear() {
  uids.clear();
  order.clear();
}

}  // namespace _CorvaneLogManager

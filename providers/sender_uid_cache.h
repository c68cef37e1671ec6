// The uid behind each unique bus name, asked of the bus once per name. The bus never hands a
// unique name to a second connection, so a kept answer stays true for as long as that bus
// lives; a name that left can never call again, and the oldest names are dropped first.
#ifndef LOGMGR_PROVIDERS_SENDER_UID_CACHE_H_
#define LOGMGR_PROVIDERS_SENDER_UID_CACHE_H_

#include <stddef.h>
#include <sys/types.h>

#include <deque>
#include <string>
#include <unordered_map>

namespace _CorvaneLogManager {

class SenderUidCache {
 public:
  // Fills |uid| with the owner of |uniqueName| on the bus |context| stands for; false when the
  // bus cannot tell (the name left, an error).
  using Lookup = bool (*)(void* context, const char* uniqueName, uid_t* uid);

  explicit SenderUidCache(size_t capacity) : capacity(capacity) {}

  // The uid of |sender| on the bus |context|. Only answers are kept: a passing bus error must
  // not stick to a live name. Answers kept for another |context| (another bus, whose names
  // start over) are forgotten first. False for a name that is not unique (":...").
  bool UidOf(const char* sender, Lookup lookup, void* context, uid_t* uid);

  void Clear();
  size_t Size() const { return uids.size(); }

 private:
  size_t capacity;
  const void* bus = nullptr;
  std::unordered_map<std::string, uid_t> uids;
  std::deque<std::string> order;  // oldest first, for eviction
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_PROVIDERS_SENDER_UID_CACHE_H_

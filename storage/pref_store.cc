// Seam: filled in by the storage layer.
#include "storage/pref_store.h"

namespace _CorvaneLogManager {

namespace {
std::string g_deviceId;
}  // namespace

const std::string& CachedDeviceId() { return g_deviceId; }

int PrefStore::Create() { return 0; }
int PrefStore::Close() { return 0; }
int PrefStore::SetLastShutdownTime(int32_t) { return 0; }
uint32_t PrefStore::GetLastShutdownTime() { return 0; }
int PrefStore::SetSentDate(int32_t) { return -1; }
uint32_t PrefStore::GetSentDate() { return 0; }
uint32_t PrefStore::NormaliseSentDate() { return 0; }

}  // namespace _CorvaneLogManager

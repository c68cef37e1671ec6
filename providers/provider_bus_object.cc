// Seam: filled in by the bus service.
#include "providers/provider_bus_object.h"

namespace _CorvaneLogManager {

void* CreateProviderBusObject(const char*) { return nullptr; }
void ReleaseProviderBusObject(void*) {}

}  // namespace _CorvaneLogManager

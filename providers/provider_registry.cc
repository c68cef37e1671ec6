// Seam: filled in by the providers layer.
#include "provider_registry.h"

#include <new>

namespace _CorvaneLogManager {

namespace {
ProviderRegistry* g_registry = nullptr;
}  // namespace

ProviderRegistry* ProviderRegistry::GetInstance() {
  if (g_registry == nullptr) g_registry = new (std::nothrow) ProviderRegistry();
  return g_registry;
}

void ProviderRegistry::Release() {
  delete g_registry;
  g_registry = nullptr;
}

ProviderRegistry::~ProviderRegistry() {}
int ProviderRegistry::CreateProviders() { return 0; }
BaseLogProvider* ProviderRegistry::Lookup(const char*) { return nullptr; }

}  // namespace _CorvaneLogManager

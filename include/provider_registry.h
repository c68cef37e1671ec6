// ProviderRegistry: the one place that creates the log providers and finds them by table name.
#ifndef LOGMGR_INCLUDE_PROVIDER_REGISTRY_H_
#define LOGMGR_INCLUDE_PROVIDER_REGISTRY_H_

namespace _CorvaneLogManager {

class BaseLogProvider;

class ProviderRegistry {
 public:
  static ProviderRegistry* GetInstance();
  // Tears the registry down, frees it and resets the singleton.
  static void Release();

  int CreateProviders();
  BaseLogProvider* Lookup(const char* name);
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_INCLUDE_PROVIDER_REGISTRY_H_

// ProviderRegistry: the one place that creates the log providers and finds them by table name.
#ifndef LOGMGR_INCLUDE_PROVIDER_REGISTRY_H_
#define LOGMGR_INCLUDE_PROVIDER_REGISTRY_H_

#include <stddef.h>

#include <map>
#include <memory>
#include <string>

namespace _CorvaneLogManager {

class BaseLogProvider;
class UseAppSurveyLogProvider;
class ManageAppSurveyLogProvider;
class UseAppFeatureSurveyLogProvider;
class ReportAppStatusSurveyLogProvider;
class AppErrorSurveyLogProvider;
class ServerUploadLogProvider;

class ProviderRegistry {
 public:
  static ProviderRegistry* GetInstance();
  // Tears the registry down, frees it and resets the singleton.
  static void Release();

  // Builds the six providers and adds each to its database manager; call before the
  // managers' Init so every table gets created. 0 / -1.
  int CreateProviders();
  // Keys: "use_app_survey", "use_app_feature_survey", "report_app_status_survey",
  // "report_app_error_survey", "manage_app_survey", "server_upload". An unknown name is
  // remembered with a null provider (map subscript); callers test for null.
  BaseLogProvider* Lookup(const char* name);
  size_t EntryCount() const { return providers.size(); }

 private:
  ProviderRegistry() = default;
  ~ProviderRegistry();
  void Teardown();
  // Frees the providers, in the order they were registered.
  void FreeProviders();

  // Owned here; the map only names them.
  std::map<std::string, BaseLogProvider*> providers;
  std::unique_ptr<UseAppSurveyLogProvider> useApp;
  std::unique_ptr<UseAppFeatureSurveyLogProvider> useAppFeature;
  std::unique_ptr<ReportAppStatusSurveyLogProvider> reportAppStatus;
  std::unique_ptr<AppErrorSurveyLogProvider> appError;
  std::unique_ptr<ManageAppSurveyLogProvider> manageApp;
  std::unique_ptr<ServerUploadLogProvider> serverUpload;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_INCLUDE_PROVIDER_REGISTRY_H_

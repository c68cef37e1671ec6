#include "include/provider_registry.h"

#include <new>

#include "providers/server_upload_log_provider.h"
#include "providers/survey_log_providers.h"
#include "storage/db_manager.h"

namespace _CorvaneLogManager {

namespace {

ProviderRegistry* g_registry = nullptr;

const char* const kKeys[] = {"use_app_survey",           "use_app_feature_survey",
                             "report_app_status_survey", "report_app_error_survey",
                             "manage_app_survey",        "server_upload"};

}  // namespace

ProviderRegistry* ProviderRegistry::GetInstance() {
  if (g_registry == nullptr) g_registry = new (std::nothrow) ProviderRegistry();
  return g_registry;
}

void ProviderRegistry::Release() {
  if (g_registry != nullptr) g_registry->Teardown();
  delete g_registry;
  g_registry = nullptr;
}

ProviderRegistry::~ProviderRegistry() {}

void ProviderRegistry::FreeProviders() {
  useApp.reset();
  useAppFeature.reset();
  reportAppStatus.reset();
  appError.reset();
  manageApp.reset();
  serverUpload.reset();
}

int ProviderRegistry::CreateProviders() {
  useApp.reset(new (std::nothrow) UseAppSurveyLogProvider());
  manageApp.reset(new (std::nothrow) ManageAppSurveyLogProvider());
  useAppFeature.reset(new (std::nothrow) UseAppFeatureSurveyLogProvider());
  reportAppStatus.reset(new (std::nothrow) ReportAppStatusSurveyLogProvider());
  appError.reset(new (std::nothrow) AppErrorSurveyLogProvider());
  serverUpload.reset(new (std::nothrow) ServerUploadLogProvider());

  BaseLogProvider* const ordered[] = {useApp.get(),   useAppFeature.get(), reportAppStatus.get(),
                                      appError.get(), manageApp.get(),     serverUpload.get()};
  bool complete = true;
  for (BaseLogProvider* provider : ordered) complete = complete && provider != nullptr;
  if (!complete) {
    FreeProviders();
    return -1;
  }

  DbManager* survey = DbManager::GetInstance();
  UploadDbManager* upload = UploadDbManager::GetInstance();
  for (int i = 0; i < 6; ++i) {
    if (i < 5) {
      if (survey != nullptr) survey->AddListener(ordered[i]);
    } else if (upload != nullptr) {
      upload->AddListener(ordered[i]);
    }
    providers[kKeys[i]] = ordered[i];
  }
  return 0;
}

BaseLogProvider* ProviderRegistry::Lookup(const char* name) {
  // Subscript on purpose: an unknown name stays in the map with a null provider.
  return providers[name == nullptr ? "" : name];
}

void ProviderRegistry::Teardown() {
  BaseLogProvider* const ordered[] = {useApp.get(),   useAppFeature.get(), reportAppStatus.get(),
                                      appError.get(), manageApp.get(),     serverUpload.get()};
  DbManager* survey = DbManager::GetInstance();
  UploadDbManager* upload = UploadDbManager::GetInstance();
  for (int i = 0; i < 5; ++i)
    if (survey != nullptr) survey->RemoveListener(ordered[i]);
  if (upload != nullptr) upload->RemoveListener(serverUpload.get());

  for (const char* key : kKeys) providers.erase(key);
  FreeProviders();
  providers.clear();
}

}  // namespace _CorvaneLogManager

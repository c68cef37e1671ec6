#include <new>

#include "providers/survey_log_providers.h"
#include "tests/providers/provider_test_env.h"

// Lets a test fail the n-th non-throwing allocation; off unless armed.
namespace {
int g_failNothrowNew = 0;
}  // namespace

void* operator new(std::size_t size, const std::nothrow_t&) noexcept {
  if (g_failNothrowNew > 0 && --g_failNothrowNew == 0) return nullptr;
  try {
    return ::operator new(size);
  } catch (...) {
    return nullptr;
  }
}

namespace _CorvaneLogManager {
namespace {

using ProviderRegistryTest = ProviderTest;

// The tables they create go through the real daemon in tests/system/test_tables.py.
TEST_F(ProviderRegistryTest, SixProvidersWithTheirTablesUntilRelease) {
  StartProviders();
  ProviderRegistry* registry = ProviderRegistry::GetInstance();
  for (const char* key : {"use_app_survey", "use_app_feature_survey", "report_app_status_survey",
                          "report_app_error_survey", "manage_app_survey", "server_upload"}) {
    BaseLogProvider* provider = registry->Lookup(key);
    ASSERT_NE(provider, nullptr) << key;
    EXPECT_STREQ(provider->GetTableName(), key);
    EXPECT_EQ(provider->Config().tableName,
              std::string(key) == "server_upload" ? "survey_log" : key);
  }
  EXPECT_EQ(DbManager::GetInstance()->Listeners().size(), 5u);
  EXPECT_EQ(UploadDbManager::GetInstance()->Listeners().size(), 1u);
  EXPECT_EQ(registry->Lookup("no_such_table"), nullptr);
  EXPECT_EQ(registry->EntryCount(), 7u);  // remembered with a null provider

  ProviderRegistry::Release();
  EXPECT_TRUE(DbManager::GetInstance()->Listeners().empty());
  EXPECT_TRUE(UploadDbManager::GetInstance()->Listeners().empty());
  EXPECT_EQ(ProviderRegistry::GetInstance()->Lookup("use_app_survey"), nullptr);
}

TEST_F(ProviderRegistryTest, FailedAllocationUndoesTheProvidersBuilt) {
  ASSERT_NE(DbManager::GetInstance(), nullptr);
  ASSERT_NE(UploadDbManager::GetInstance(), nullptr);
  ProviderRegistry* registry = ProviderRegistry::GetInstance();
  g_failNothrowNew = 4;  // the fourth provider
  int result = registry->CreateProviders();
  g_failNothrowNew = 0;
  EXPECT_EQ(result, -1);
  EXPECT_EQ(registry->EntryCount(), 0u);
  EXPECT_TRUE(DbManager::GetInstance()->Listeners().empty());
  ASSERT_EQ(registry->CreateProviders(), 0);  // the start idler's retry
  EXPECT_NE(registry->Lookup("manage_app_survey"), nullptr);

  // A provider built while its manager cannot be had stays undescribed for good.
  DbManager::CloseInstance();
  g_failNothrowNew = 2;  // the provider itself succeeds, the manager fails
  BaseLogProvider* orphan = new (std::nothrow) ManageAppSurveyLogProvider();
  g_failNothrowNew = 0;
  ASSERT_NE(orphan, nullptr);
  EXPECT_TRUE(orphan->Config().columns.empty());
  ASSERT_EQ(DbManager::GetInstance()->Init(), 0);
  EXPECT_EQ(orphan->InsertRow("installed_app_id", "'a'"), -1);
  delete orphan;
}

}  // namespace
}  // namespace _CorvaneLogManager

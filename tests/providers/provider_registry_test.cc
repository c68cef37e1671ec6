#include <new>

#include "provider_test_env.h"
#include "providers/server_upload_log_provider.h"
#include "providers/survey_log_providers.h"

// Counts non-throwing allocations so a test can make the n-th one fail; off unless armed.
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

// sqlite_master keeps the text from the table name on, without "IF NOT EXISTS" and ";".
std::string StoredForm(std::string create) {
  const std::string prefix = "CREATE TABLE IF NOT EXISTS ";
  EXPECT_EQ(create.compare(0, prefix.size(), prefix), 0);
  create.replace(0, prefix.size(), "CREATE TABLE ");
  EXPECT_EQ(create.back(), ';');
  create.pop_back();
  return create;
}

TEST_F(ProviderRegistryTest, BuildsSixProvidersWhoseTablesExistAsDeclared) {
  StartProviders();
  ProviderRegistry* registry = ProviderRegistry::GetInstance();
  struct Case {
    const char* key;
    const char* table;
    DbConnection* conn;
  } cases[] = {
      {"use_app_survey", "use_app_survey", survey},
      {"use_app_feature_survey", "use_app_feature_survey", survey},
      {"report_app_status_survey", "report_app_status_survey", survey},
      {"report_app_error_survey", "report_app_error_survey", survey},
      {"manage_app_survey", "manage_app_survey", survey},
      {"server_upload", "survey_log", upload},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.key);
    BaseLogProvider* provider = registry->Lookup(c.key);
    ASSERT_NE(provider, nullptr);
    EXPECT_STREQ(provider->GetTableName(), c.key);
    EXPECT_EQ(provider->Config().tableName, c.table);
    EXPECT_EQ(Text(c.conn, std::string("SELECT sql FROM sqlite_master WHERE name='") + c.table +
                               "'"),
              StoredForm(provider->GetCreateTableSql()));
    // Every declared column is a column of the real table.
    for (const std::string& column : provider->Config().columns)
      EXPECT_GE(Scalar(c.conn, "SELECT COUNT(" + column + ") FROM " + c.table), 0) << column;
  }
  EXPECT_EQ(registry->EntryCount(), 6u);
  EXPECT_EQ(DbManager::GetInstance()->Listeners().size(), 5u);
  EXPECT_EQ(UploadDbManager::GetInstance()->Listeners().size(), 1u);
  EXPECT_EQ(Scalar(survey, "SELECT COUNT(*) FROM sqlite_master WHERE type='table' AND name NOT "
                           "LIKE 'sqlite_%'"),
            5);

  // Unknown names are remembered with a null provider.
  EXPECT_EQ(registry->Lookup("no_such_table"), nullptr);
  EXPECT_EQ(registry->EntryCount(), 7u);

  ProviderRegistry::Release();
  EXPECT_TRUE(DbManager::GetInstance()->Listeners().empty());
  EXPECT_TRUE(UploadDbManager::GetInstance()->Listeners().empty());
  registry = ProviderRegistry::GetInstance();
  EXPECT_EQ(registry->Lookup("use_app_survey"), nullptr);
  EXPECT_EQ(registry->EntryCount(), 1u);
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
  EXPECT_EQ(registry->Lookup("use_app_survey"), nullptr);
  EXPECT_TRUE(DbManager::GetInstance()->Listeners().empty());
  // A second attempt succeeds from scratch (the start idler retries).
  ASSERT_EQ(registry->CreateProviders(), 0);
  EXPECT_NE(registry->Lookup("manage_app_survey"), nullptr);
}

TEST_F(ProviderRegistryTest, ProvidersWithoutAManagerConnectionStayInert) {
  // The survey manager exists only after this point; a provider made before has no table.
  DbManager::CloseInstance();
  UseAppSurveyLogProvider* orphan = nullptr;
  {
    // The manager is the second non-throwing allocation here; let it fail.
    g_failNothrowNew = 2;
    orphan = new (std::nothrow) UseAppSurveyLogProvider();
    g_failNothrowNew = 0;
  }
  ASSERT_NE(orphan, nullptr);
  EXPECT_TRUE(orphan->Config().tableName.empty());
  EXPECT_TRUE(orphan->Config().columns.empty());
  EXPECT_STREQ(orphan->GetTableName(), "use_app_survey");
  ASSERT_NE(DbManager::GetInstance(), nullptr);
  ASSERT_EQ(DbManager::GetInstance()->Init(), 0);
  EXPECT_EQ(orphan->InsertRow("app_id", "'a'"), -1);
  delete orphan;
}

}  // namespace
}  // namespace _CorvaneLogManager

#include "providers/survey_log_providers.h"

#include "providers/provider_bus_object.h"
#include "storage/db_manager.h"

namespace _CorvaneLogManager {

namespace {

constexpr int32_t kCheckInterval = 500;
constexpr int32_t kMaxRows = 5000;

// Indexed by SurveyTable. Status reports are kept 10 days, everything else 3 (deliberate).
const SurveyTableInfo kSurveyTables[] = {
    {"use_app_survey", "_id,timestamp,time_zone,app_id,duration",
     "CREATE TABLE IF NOT EXISTS use_app_survey(_id INTEGER PRIMARY KEY AUTOINCREMENT, "
     "timestamp INTEGER, time_zone TEXT, app_id TEXT, duration INTEGER );",
     3, false},
    {"manage_app_survey", "_id,timestamp,time_zone,installed_app_id,type",
     "CREATE TABLE IF NOT EXISTS manage_app_survey(_id INTEGER PRIMARY KEY AUTOINCREMENT, "
     "timestamp INTEGER, time_zone TEXT, installed_app_id TEXT, type INTEGER DEFAULT 0 );",
     3, false},
    {"report_app_error_survey", "_id,timestamp,time_zone,app_id,type",
     "CREATE TABLE IF NOT EXISTS report_app_error_survey(_id INTEGER PRIMARY KEY AUTOINCREMENT, "
     "timestamp INTEGER, time_zone TEXT, app_id TEXT, type INTEGER );",
     3, false},
    {"use_app_feature_survey", "_id,timestamp,time_zone,app_id,feature,extra,value",
     "CREATE TABLE IF NOT EXISTS use_app_feature_survey(_id INTEGER PRIMARY KEY AUTOINCREMENT, "
     "timestamp INTEGER, time_zone TEXT, app_id TEXT, feature TEXT, extra TEXT, value INTEGER);",
     3, true},
    {"report_app_status_survey", "_id,timestamp,time_zone,app_id,feature,extra,value",
     "CREATE TABLE IF NOT EXISTS report_app_status_survey(_id INTEGER PRIMARY KEY "
     "AUTOINCREMENT, timestamp INTEGER, time_zone TEXT, app_id TEXT, feature TEXT, extra TEXT, "
     "value INTEGER);",
     10, true},
};

}  // namespace

const SurveyTableInfo& GetSurveyTableInfo(SurveyTable table) {
  return kSurveyTables[static_cast<int>(table)];
}

SurveyLogProvider::SurveyLogProvider(SurveyTable table) : info(GetSurveyTableInfo(table)) {
  DbManager* manager = DbManager::GetInstance();
  // Without the manager's connection the table stays undescribed and every operation fails;
  // deliberately never retried.
  if (manager == nullptr || manager->GetConnection() == nullptr) return;
  (void)InitTableConfig(info.tableName, info.columnList, info.retentionDays, kCheckInterval,
                        kMaxRows, 0);
  if (info.busObject) busObject = CreateProviderBusObject(info.tableName);
}

SurveyLogProvider::~SurveyLogProvider() {
  if (busObject != nullptr) ReleaseProviderBusObject(busObject);
}

const char* SurveyLogProvider::GetCreateTableSql() { return info.createSql; }

const char* SurveyLogProvider::GetTableName() { return info.tableName; }

}  // namespace _CorvaneLogManager

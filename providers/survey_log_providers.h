// The five survey tables: one data row each (name, columns, CREATE text, retention) and one
// class that carries them; the two shared tables also hold their bus object.
#ifndef LOGMGR_PROVIDERS_SURVEY_LOG_PROVIDERS_H_
#define LOGMGR_PROVIDERS_SURVEY_LOG_PROVIDERS_H_

#include <stdint.h>

#include "include/base_log_provider.h"

namespace _CorvaneLogManager {

enum class SurveyTable { kUseApp, kManageApp, kAppError, kUseAppFeature, kReportAppStatus };

struct SurveyTableInfo {
  const char* tableName;
  const char* columnList;
  const char* createSql;
  int32_t retentionDays;
  bool busObject;  // shared with other processes through a bus object
};

const SurveyTableInfo& GetSurveyTableInfo(SurveyTable table);

class SurveyLogProvider : public BaseLogProvider {
 public:
  ~SurveyLogProvider() override;
  const char* GetCreateTableSql() override;
  const char* GetTableName() override;

 protected:
  explicit SurveyLogProvider(SurveyTable table);

 private:
  const SurveyTableInfo& info;
  void* busObject = nullptr;  // the bus object of a shared table, null for the others
};

class UseAppSurveyLogProvider final : public SurveyLogProvider {
 public:
  UseAppSurveyLogProvider() : SurveyLogProvider(SurveyTable::kUseApp) {}
};

class ManageAppSurveyLogProvider final : public SurveyLogProvider {
 public:
  ManageAppSurveyLogProvider() : SurveyLogProvider(SurveyTable::kManageApp) {}
};

class AppErrorSurveyLogProvider final : public SurveyLogProvider {
 public:
  AppErrorSurveyLogProvider() : SurveyLogProvider(SurveyTable::kAppError) {}
};

class UseAppFeatureSurveyLogProvider final : public SurveyLogProvider {
 public:
  UseAppFeatureSurveyLogProvider() : SurveyLogProvider(SurveyTable::kUseAppFeature) {}
};

class ReportAppStatusSurveyLogProvider final : public SurveyLogProvider {
 public:
  ReportAppStatusSurveyLogProvider() : SurveyLogProvider(SurveyTable::kReportAppStatus) {}
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_PROVIDERS_SURVEY_LOG_PROVIDERS_H_

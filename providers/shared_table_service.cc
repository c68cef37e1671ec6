#include "providers/shared_table_service.h"

#include <stdlib.h>
#include <string.h>

#include "include/base_log_provider.h"
#include "include/db_connection.h"
#include "include/provider_registry.h"
#include "providers/provider_bus_guard.h"
#include "storage/db_manager.h"

namespace _CorvaneLogManager {

namespace {

using Result = SharedTableService::Result;

DbConnection* SurveyConnection() {
  DbManager* manager = DbManager::GetInstance();
  return manager == nullptr ? nullptr : manager->GetConnection();
}

// The value of |key|, null when the caller did not send it.
const std::string* ValueOf(const SharedTableService::RowData& rowData, const char* key) {
  for (const auto& entry : rowData)
    if (entry.first == key) return &entry.second;
  return nullptr;
}

// row_data as the provider's column and value lists; false when an entry is refused.
bool BuildLists(BaseLogProvider* provider, const SharedTableService::RowData& rowData,
                BusRowLists* lists) {
  for (const auto& entry : rowData) {
    if (AppendRowEntry(provider->Config().columns, entry.first.c_str(), entry.second.c_str(),
                       lists) != 0)
      return false;
  }
  return true;
}

}  // namespace

const SharedTableService SharedTableService::kTables[] = {
    {"use_app_feature_survey", InsertMode::kPlain, true, true},
    {"report_app_status_survey", InsertMode::kUpsertOnAppFeature, false, false},
};

const SharedTableService* SharedTableService::ForTable(const char* tableName) {
  if (tableName == nullptr) return nullptr;
  for (const SharedTableService& table : kTables)
    if (strcmp(table.tableName, tableName) == 0) return &table;
  return nullptr;
}

BaseLogProvider* SharedTableService::Provider() const {
  ProviderRegistry* registry = ProviderRegistry::GetInstance();
  return registry == nullptr ? nullptr : registry->Lookup(tableName);
}

Result SharedTableService::Insert(const RowData& rowData, int32_t* lastRowId) const {
  BaseLogProvider* provider = Provider();
  if (provider == nullptr) return Result::kProviderMissing;
  if (ValueOf(rowData, "app_id") == nullptr || ValueOf(rowData, "feature") == nullptr)
    return Result::kImproperValues;
  BusRowLists lists;
  if (!BuildLists(provider, rowData, &lists)) return Result::kImproperValues;
  if (insert == InsertMode::kUpsertOnAppFeature)
    return UpsertInsert(provider, rowData, lists, lastRowId);
  return PlainInsert(provider, lists, lastRowId);
}

Result SharedTableService::PlainInsert(BaseLogProvider* provider, const BusRowLists& lists,
                                       int32_t* lastRowId) const {
  if (!provider->InsertFits(lists.columns.c_str(), lists.values.c_str()))
    return Result::kImproperValues;
  DbConnection::BusRequestScope scope(SurveyConnection(), tableName);
  int32_t rowId = -1;
  if (!scope.Held() ||
      provider->InsertRow(lists.columns.c_str(), lists.values.c_str(), &rowId) == -1)
    return Result::kInsertFailed;
  *lastRowId = rowId;
  return Result::kOk;
}

Result SharedTableService::UpsertInsert(BaseLogProvider* provider, const RowData& rowData,
                                        const BusRowLists& lists, int32_t* lastRowId) const {
  std::string condition = "app_id='" + *ValueOf(rowData, "app_id") + "' and feature='" +
                          *ValueOf(rowData, "feature") + "'";
  // The update's 200-byte lists and its comma split only matter when the pair exists.
  if (!provider->SelectFits("_id", condition.c_str()) ||
      !provider->InsertFits(lists.columns.c_str(), lists.values.c_str()))
    return Result::kImproperValues;

  DbConnection::BusRequestScope scope(SurveyConnection(), tableName);
  if (!scope.Held()) return Result::kApiFailed;
  QueryRows rows;
  if (provider->SelectRows("_id", condition.c_str(), nullptr, &rows.count, &rows.rows) == -1)
    return Result::kApiFailed;
  if (rows.count == 1) {
    // The row text ends in a comma, which stops the conversion.
    *lastRowId = static_cast<int32_t>(strtol(rows[0], nullptr, 10));
    if (lists.valueHasComma ||
        !provider->UpdateFits(lists.columns.c_str(), lists.values.c_str(), condition.c_str()))
      return Result::kApiFailed;
    if (provider->UpdateRows(lists.columns.c_str(), lists.values.c_str(), condition.c_str()) == -1)
      return Result::kApiFailed;
    return Result::kOk;
  }
  if (rows.count > 1) return Result::kOk;  // ambiguous pair: nothing is written, deliberately
  int32_t rowId = -1;
  if (provider->InsertRow(lists.columns.c_str(), lists.values.c_str(), &rowId) == -1)
    return Result::kInsertFailed;
  *lastRowId = rowId;
  return Result::kOk;
}

Result SharedTableService::Update(const RowData& rowData, const char* where, int32_t* count) const {
  BaseLogProvider* provider = Provider();
  if (provider == nullptr) return Result::kProviderMissing;
  BusRowLists lists;
  if (!BuildLists(provider, rowData, &lists)) return Result::kUpdateFailed;
  const char* condition = where != nullptr && where[0] != '\0' ? where : nullptr;
  if (lists.valueHasComma ||
      !provider->UpdateFits(lists.columns.c_str(), lists.values.c_str(), condition))
    return Result::kUpdateFailed;
  DbConnection::BusRequestScope scope(SurveyConnection(), tableName);
  int32_t changed = 0;
  if (!scope.Held() ||
      provider->UpdateRows(lists.columns.c_str(), lists.values.c_str(), condition, &changed) == -1)
    return Result::kUpdateFailed;
  *count = changed;
  return Result::kOk;
}

Result SharedTableService::Select(const char* columns, int shmId, bool callerKnown,
                                  uid_t caller) const {
  BaseLogProvider* provider = Provider();
  if (provider == nullptr) return Result::kProviderMissing;
  if (columns == nullptr || !provider->SelectFits(columns, nullptr)) return Result::kSelectFailed;
  QueryRows rows;
  {
    DbConnection::BusRequestScope scope(SurveyConnection(), tableName);
    if (!scope.Held()) return Result::kSelectFailed;
    // Rendering stops where the result stops fitting the segment; a segment that is not the
    // caller's takes nothing.
    scope.LimitResult(callerKnown ? SegmentRoom(shmId, caller) : 0);
    if (provider->SelectRows(columns, nullptr, nullptr, &rows.count, &rows.rows) != 0)
      return scope.ResultTooLarge() ? Result::kNotWritten : Result::kSelectFailed;
  }
  // The segment gets a copy; the rows stay here and go with this call.
  if (!callerKnown || WriteRowsToSegment(shmId, caller, rows) != 0) return Result::kNotWritten;
  return Result::kOk;
}

Result SharedTableService::Delete(const char* where, int32_t* count) const {
  BaseLogProvider* provider = Provider();
  if (provider == nullptr) return Result::kProviderMissing;
  if (deleteNeedsWhere && (where == nullptr || where[0] == '\0')) return Result::kImproperValues;
  int32_t deleted = 0;
  int result = -1;
  if (where != nullptr && provider->DeleteFits(where)) {
    DbConnection::BusRequestScope scope(SurveyConnection(), tableName);
    if (scope.Held()) result = provider->DeleteRows(where, &deleted);
  }
  if (result == -1) {
    if (deleteFailureIsError) return Result::kDeleteFailed;
    deleted = 0;
  }
  *count = deleted;
  return Result::kOk;
}

}  // namespace _CorvaneLogManager

#include "include/base_log_provider.h"

#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <strings.h>
#include <unistd.h>

#include <atomic>

#include "base/clock.h"
#include "include/db_connection.h"
#include "providers/local_zone.h"
#include "providers/statement_buffer.h"
#include "providers/statement_builder.h"
#include "storage/db_manager.h"

namespace _CorvaneLogManager {

namespace {

// Row counts are checked against this many oldest rows and seeded modulo it, whatever the
// table's own check interval says.
constexpr int kTrimBatch = 500;
constexpr long long kMsPerDay = 86400000LL;
// Where a survey table's update cuts its lists.
constexpr char kUpdateDelims[] = ",";

DbConnection* SurveyConnection() {
  DbManager* manager = DbManager::GetInstance();
  return manager == nullptr ? nullptr : manager->GetConnection();
}

// values += "," + the decimal text of |n|, as "%lld" writes it (once per insert, so no printf).
void AppendCommaAndNumber(std::string* values, long long n) {
  char text[24];
  char* end = text + sizeof(text);
  char* p = end;
  unsigned long long magnitude =
      n < 0 ? 0ULL - static_cast<unsigned long long>(n) : static_cast<unsigned long long>(n);
  do {
    *--p = static_cast<char>('0' + magnitude % 10);
    magnitude /= 10;
  } while (magnitude != 0);
  if (n < 0) *--p = '-';
  *--p = ',';
  values->append(p, static_cast<size_t>(end - p));
}

bool IsSqlBlank(char c) { return c == ' ' || c == '\t' || c == '\n' || c == '\r' || c == '\f'; }

bool EndsToken(char c) { return c == '\0' || c == ',' || IsSqlBlank(c); }

}  // namespace

int ParsePlainLiterals(const char* text, DbConnection::BoundValue* out, int room, char* decoded,
                       size_t decodedSize) {
  const char* p = text;
  size_t used = 0;
  int count = 0;
  for (;;) {
    while (IsSqlBlank(*p)) ++p;
    if (count == room) return -1;
    DbConnection::BoundValue& value = out[count];
    if (*p == '\'') {
      // A string literal: up to the quote not followed by another; "''" stands for "'".
      size_t start = used;
      ++p;
      for (;;) {
        // Up to the next quote in one copy: a record body is a few hundred bytes.
        const char* quote = strchr(p, '\'');
        if (quote == nullptr) return -1;  // unterminated
        size_t run = static_cast<size_t>(quote - p);
        bool doubled = quote[1] == '\'';
        if (used + run + (doubled ? 1 : 0) >= decodedSize) return -1;
        memcpy(decoded + used, p, run);
        used += run;
        if (!doubled) {
          p = quote + 1;  // past the closing quote
          break;
        }
        decoded[used++] = '\'';
        p = quote + 2;
      }
      value = {DbConnection::BoundValue::kText, 0, decoded + start, static_cast<int>(used - start)};
    } else if ((*p >= '0' && *p <= '9') || (*p == '-' && p[1] >= '0' && p[1] <= '9')) {
      // An integer of at most 18 digits: what SQLite reads from it is exactly this value, never
      // a real. "-" right before the digits negates it, as the statement's unary minus would.
      bool negative = *p == '-';
      if (negative) ++p;
      int64_t number = 0;
      int digits = 0;
      for (; *p >= '0' && *p <= '9'; ++p, ++digits) {
        if (digits == 18) return -1;
        number = number * 10 + (*p - '0');
      }
      if (!EndsToken(*p)) return -1;  // a real, hex, a digit separator, a word
      value = {DbConnection::BoundValue::kInteger, negative ? -number : number, nullptr, 0};
    } else if (strncasecmp(p, "null", 4) == 0 && EndsToken(p[4])) {
      p += 4;
      value = {DbConnection::BoundValue::kNull, 0, nullptr, 0};
    } else {
      return -1;  // an expression, a blob, a quoted name, a comment...
    }
    ++count;
    while (IsSqlBlank(*p)) ++p;
    if (*p == '\0') return count;
    if (*p != ',') return -1;
    ++p;
  }
}

uint64_t BaseLogProvider::NewInstanceId() {
  static std::atomic<uint64_t> last{0};
  return ++last;
}

int BaseLogProvider::InitTableConfig(const char* tableName, const char* columnList,
                                     int32_t retentionDays, int32_t checkInterval, int32_t maxRows,
                                     int32_t initialCounter) {
  config.tableName = tableName;
  config.retention_days = retentionDays;
  config.check_interval = checkInterval;
  config.max_rows = maxRows;
  config.insert_counter = initialCounter;

  char buf[kListSize];
  CopyListOrDie(buf, columnList);
  char* save = nullptr;
  for (char* tok = strtok_r(buf, ", ", &save); tok != nullptr; tok = strtok_r(nullptr, ", ", &save))
    config.columns.push_back(tok);
  return 0;
}

int BaseLogProvider::ValidateColumns(const char* columnList) {
  if (columnList == nullptr) return 0;
  // The declared columns never change, so a list found valid stays valid: collectors and the
  // report builder repeat theirs on every insert. Per thread, as providers serve two.
  thread_local uint64_t validOwner = 0;
  thread_local std::string validList;
  if (validOwner == instanceId && validList == columnList) return 0;
  char buf[kListSize];
  CopyListOrDie(buf, columnList);
  char* save = nullptr;
  char* tok = strtok_r(buf, ",", &save);
  if (tok == nullptr || config.columns.empty()) return -1;
  for (; tok != nullptr; tok = strtok_r(nullptr, ",", &save)) {
    bool declared = false;
    for (const std::string& column : config.columns) {
      if (column == tok) {
        declared = true;
        break;
      }
    }
    if (!declared) return -1;
  }
  validOwner = instanceId;
  validList = columnList;
  return 0;
}

void BaseLogProvider::AppendAutoColumns(std::string* columns, std::string* values) {
  for (const std::string& column : config.columns) {
    if (column[0] != 't') continue;  // neither automatic column
    if (column == "timestamp") {
      columns->append(",timestamp");
      AppendCommaAndNumber(values, WallClockMs());
    } else if (column == "time_zone") {
      std::string zone;
      if (!LocalZoneLiteral(&zone)) continue;  // unreadable or no zone
      columns->append(",time_zone");
      values->push_back(',');
      values->append(zone);
    }
  }
}

int32_t BaseLogProvider::AdvanceInsertCounter() {
  config.insert_counter = (config.insert_counter + 1) % config.check_interval;
  return config.insert_counter;
}

int32_t BaseLogProvider::TickInsertCounter() {
  config.insert_counter = (config.insert_counter + 1) % config.check_interval;
  return config.insert_counter == 1 ? config.check_interval : 0;
}

int BaseLogProvider::Initialize() {
  DbConnection* conn = SurveyConnection();
  if (conn == nullptr) return 0;
  {
    // Creating the table is the one schema change the connection allows, and only here.
    DbConnection::SetupScope setup(conn);
    if (conn->Exec(GetCreateTableSql()) != 0) return -1;
  }
  if (conn->TableExists(config.tableName.c_str()) == 1)
    config.insert_counter = GetRowCount() % kTrimBatch;
  else
    config.insert_counter = 0;
  // The seeded counter, not a plain status: callers only test for -1.
  return config.insert_counter;
}

int BaseLogProvider::DeleteExpiredRows() {
  DbConnection* conn = SurveyConnection();
  if (conn == nullptr) return 0;
  char where[50];
  snprintf(where, sizeof(where), "timestamp < %lld",
           static_cast<long long>(WallClockMs()) -
               static_cast<long long>(config.retention_days) * kMsPerDay);
  char sql[kStatementSize];
  (void)BuildDelete(config.tableName, where, sql);
  return conn->Exec(sql) == 0 ? 0 : -1;
}

int BaseLogProvider::InsertRow(const char* columns, const char* values, int32_t* rowId) {
  return InsertOn(SurveyConnection(), columns, values, rowId, true);
}

int BaseLogProvider::InsertOn(DbConnection* conn, const char* columns, const char* values,
                              int32_t* rowId, bool countRows) {
  if (conn == nullptr || columns == nullptr || values == nullptr) return -1;
  std::string columnText;
  std::string valueText;
  // Room for the automatic columns up front: appending them then copies nothing.
  columnText.reserve(strlen(columns) + 32);
  valueText.reserve(strlen(values) + 80);
  columnText.append(columns);
  valueText.append(values);
  if (columnText.empty() || valueText.empty()) return -1;
  if (ValidateColumns(columnText.c_str()) != 0) return -1;
  AppendAutoColumns(&columnText, &valueText);
  int32_t check = countRows ? TickInsertCounter() : 0;

  int result = DbConnection::kNotRun;
  // Only a text that fits the buffer may be served otherwise; a cut one is run as cut.
  if (InsertLength(config.tableName, columnText.size(), valueText.size()) < kStatementSize)
    result = InsertKept(conn, columnText.c_str(), valueText.c_str());
  if (result == DbConnection::kNotRun) {
    char sql[kStatementSize];
    (void)BuildInsert(config.tableName, columnText.c_str(), valueText.c_str(), sql);
    result = conn->Exec(sql);
  }
  if (rowId != nullptr) *rowId = result == 0 ? conn->LastInsertRowId() : -1;
  if (result != 0) return -1;
  // Counting rows costs a full scan, so only the insert that wraps the counter does it.
  if (check > 0 && GetRowCount() > config.max_rows) (void)DeleteOldestRows();
  return 0;
}

int BaseLogProvider::InsertKept(DbConnection* conn, const char* columns, const char* values) {
  DbConnection::BoundValue bound[kListSize];
  char decoded[kStatementSize];
  int count = ParsePlainLiterals(values, bound, kListSize, decoded, sizeof(decoded));
  if (count <= 0) return DbConnection::kNotRun;
  // The statement of the last column list, per thread: callers repeat theirs.
  thread_local uint64_t lastOwner = 0;
  thread_local std::string lastColumns;
  thread_local std::string lastSql;
  thread_local int lastCount = 0;
  if (lastOwner != instanceId || lastColumns != columns) {
    int columnCount = 1;
    for (const char* c = columns; *c != '\0'; ++c) columnCount += *c == ',' ? 1 : 0;
    std::string sql = "INSERT INTO " + config.tableName + "(" + columns + ") VALUES (";
    for (int i = 0; i < columnCount; ++i) sql += i == 0 ? "?" : ",?";
    sql += ");";
    lastOwner = instanceId;
    lastColumns = columns;
    lastSql = sql;
    lastCount = columnCount;
  }
  // Miscounted lists fail on the text path, with its own answer.
  if (lastCount != count) return DbConnection::kNotRun;
  return conn->ExecKept(lastSql.c_str(), bound, count);
}

int BaseLogProvider::UpdateRows(const char* columns, const char* values, const char* where,
                                int32_t* count) {
  return UpdateOn(SurveyConnection(), columns, values, where, count, true, kUpdateDelims);
}

int BaseLogProvider::UpdateOn(DbConnection* conn, const char* columns, const char* values,
                              const char* where, int32_t* count, bool autoColumns,
                              const char* splitDelims) {
  if (conn == nullptr || columns == nullptr || values == nullptr) return -1;
  std::string columnText(columns);
  std::string valueText(values);
  if (columnText.empty() || valueText.empty() || where == nullptr) return -1;
  if (ValidateColumns(columnText.c_str()) != 0) return -1;
  if (autoColumns) AppendAutoColumns(&columnText, &valueText);

  char sql[kStatementSize];
  // A list or the SET text past its buffer ends the process; a cut statement runs as cut.
  if (BuildUpdate(config.tableName, columnText.c_str(), valueText.c_str(), where, splitDelims,
                  sql) == StatementFit::kOverflow)
    abort();
  int result = conn->Exec(sql);
  if (count != nullptr) *count = result == 0 ? conn->Changes() : 0;
  return result == 0 ? 0 : -1;
}

int BaseLogProvider::SelectRows(const char* columns, const char* where, const char* orderBy,
                                int* rowCount, char*** rows) {
  return SelectGroupedRows(columns, where, orderBy, nullptr, rowCount, rows);
}

int BaseLogProvider::SelectGroupedRows(const char* columns, const char* where, const char* orderBy,
                                       const char* groupBy, int* rowCount, char*** rows) {
  DbConnection* conn = SurveyConnection();
  if (conn == nullptr) return -1;
  char sql[kStatementSize];
  if (BuildSelect(config.tableName, columns, where, groupBy, orderBy, sql) != StatementFit::kWhole)
    abort();
  return conn->Select(sql, config.tableName.c_str(), rowCount, rows);
}

int BaseLogProvider::DeleteRows(const char* where, int32_t* count) {
  return DeleteOn(SurveyConnection(), where, count);
}

int BaseLogProvider::DeleteOn(DbConnection* conn, const char* where, int32_t* count) {
  if (conn == nullptr || where == nullptr) return -1;
  char sql[kStatementSize];
  (void)BuildDelete(config.tableName, where, sql);
  int result = conn->Exec(sql);
  if (count != nullptr) *count = result == 0 ? conn->Changes() : 0;
  return result == 0 ? 0 : -1;
}

bool BaseLogProvider::InsertFits(const char* columns, const char* values) {
  std::string autoColumns;
  std::string autoValues;
  AppendAutoColumns(&autoColumns, &autoValues);
  return InsertStatementFits(config.tableName, columns, values, autoColumns, autoValues);
}

bool BaseLogProvider::UpdateFits(const char* columns, const char* values, const char* where) {
  std::string autoColumns;
  std::string autoValues;
  AppendAutoColumns(&autoColumns, &autoValues);
  return UpdateStatementFits(config.tableName, columns, values, autoColumns, autoValues, where,
                             kUpdateDelims);
}

bool BaseLogProvider::SelectFits(const char* columns, const char* where) {
  return SelectStatementFits(config.tableName, columns, where);
}

bool BaseLogProvider::DeleteFits(const char* where) {
  return DeleteStatementFits(config.tableName, where);
}

int BaseLogProvider::GetRowCount() {
  DbConnection* conn = SurveyConnection();
  if (conn == nullptr) return -1;
  return conn->Count(config.tableName.c_str());
}

int BaseLogProvider::DeleteOldestRows() { return DeleteOldestOn(SurveyConnection()); }

int BaseLogProvider::DeleteOldestOn(DbConnection* conn) {
  if (conn == nullptr) return -1;
  char sql[kStatementSize];
  snprintf(sql, sizeof(sql), "DELETE FROM %s WHERE _id < (SELECT MIN(_id) FROM %s) + %d;",
           config.tableName.c_str(), config.tableName.c_str(), kTrimBatch);
  return conn->Exec(sql) == 0 ? 0 : -1;
}

}  // namespace _CorvaneLogManager

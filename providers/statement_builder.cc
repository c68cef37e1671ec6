#include "providers/statement_builder.h"

#include <stdio.h>
#include <string.h>

#include "providers/statement_buffer.h"

namespace _CorvaneLogManager {

namespace {

StatementFit Formatted(int length) {
  return length >= 0 && static_cast<size_t>(length) < kStatementSize ? StatementFit::kWhole
                                                                     : StatementFit::kCut;
}

}  // namespace

size_t InsertLength(const std::string& table, size_t columns, size_t values) {
  return sizeof("INSERT INTO () VALUES ();") - 1 + table.size() + columns + values;
}

StatementFit BuildInsert(const std::string& table, const char* columns, const char* values,
                         char* sql) {
  return Formatted(snprintf(sql, kStatementSize, "INSERT INTO %s(%s) VALUES (%s);", table.c_str(),
                            columns, values));
}

StatementFit BuildUpdate(const std::string& table, const char* columns, const char* values,
                         const char* where, const char* splitDelims, char* sql) {
  char columnBuf[kListSize];
  char valueBuf[kListSize];
  if (!CopyList(columnBuf, columns) || !CopyList(valueBuf, values)) return StatementFit::kOverflow;

  char set[kStatementSize] = "";
  char* columnSave = nullptr;
  char* valueSave = nullptr;
  char* column = strtok_r(columnBuf, splitDelims, &columnSave);
  char* value = strtok_r(valueBuf, splitDelims, &valueSave);
  // Surplus tokens of the longer list are ignored; a value holding a delimiter is split.
  while (column != nullptr && value != nullptr) {
    char pair[kStatementSize];
    (void)snprintf(pair, sizeof(pair), value[0] == '\'' ? "%s = %s," : "%s = '%s',", column, value);
    if (!AppendFits(set, sizeof(set), pair)) return StatementFit::kOverflow;
    column = strtok_r(nullptr, splitDelims, &columnSave);
    value = strtok_r(nullptr, splitDelims, &valueSave);
  }
  size_t setLen = strlen(set);
  if (setLen > 0) set[setLen - 1] = '\0';
  return Formatted(
      snprintf(sql, kStatementSize, "UPDATE %s SET %s WHERE %s;", table.c_str(), set, where));
}

StatementFit BuildSelect(const std::string& table, const char* columns, const char* where,
                         const char* groupBy, const char* orderBy, char* sql) {
  // A first part that is cut leaves no room for the ";", so every shortfall is an overflow.
  (void)snprintf(sql, kStatementSize, "SELECT %s FROM %s", columns == nullptr ? "*" : columns,
                 table.c_str());
  bool whole = AppendClauseFits(sql, kStatementSize, " WHERE %s", where) &&
               AppendClauseFits(sql, kStatementSize, " GROUP BY %s", groupBy) &&
               AppendClauseFits(sql, kStatementSize, " ORDER BY %s", orderBy) &&
               AppendFits(sql, kStatementSize, ";");
  return whole ? StatementFit::kWhole : StatementFit::kOverflow;
}

StatementFit BuildDelete(const std::string& table, const char* where, char* sql) {
  return Formatted(snprintf(sql, kStatementSize, "DELETE FROM %s WHERE %s;", table.c_str(), where));
}

bool InsertStatementFits(const std::string& table, const std::string& columns,
                         const std::string& values, const std::string& autoColumns,
                         const std::string& autoValues) {
  if (columns.size() >= kListSize) return false;
  char sql[kStatementSize];
  return BuildInsert(table, (columns + autoColumns).c_str(), (values + autoValues).c_str(), sql) ==
         StatementFit::kWhole;
}

bool UpdateStatementFits(const std::string& table, const std::string& columns,
                         const std::string& values, const std::string& autoColumns,
                         const std::string& autoValues, const char* where,
                         const char* splitDelims) {
  if (where == nullptr) return true;
  char sql[kStatementSize];
  return BuildUpdate(table, (columns + autoColumns).c_str(), (values + autoValues).c_str(), where,
                     splitDelims, sql) == StatementFit::kWhole;
}

bool SelectStatementFits(const std::string& table, const char* columns, const char* where) {
  char sql[kStatementSize];
  return BuildSelect(table, columns, where, nullptr, nullptr, sql) == StatementFit::kWhole;
}

bool DeleteStatementFits(const std::string& table, const char* where) {
  char sql[kStatementSize];
  return BuildDelete(table, where, sql) == StatementFit::kWhole;
}

}  // namespace _CorvaneLogManager

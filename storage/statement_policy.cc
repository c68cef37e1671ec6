#include "storage/statement_policy.h"

#include <sqlite3.h>
#include <string.h>
#include <strings.h>

namespace _CorvaneLogManager {

namespace {

bool IsSchemaTable(const char* name) {
  if (name == nullptr) return false;
  static const char* const kSchema[] = {"sqlite_master", "sqlite_schema", "sqlite_temp_master",
                                        "sqlite_temp_schema"};
  for (const char* schema : kSchema)
    if (strcasecmp(name, schema) == 0) return true;
  return false;
}

// Functions that make large values out of little input, or reach outside the database.
bool IsDeniedBusFunction(const char* name) {
  static const char* const kDenied[] = {"randomblob", "zeroblob",  "load_extension",
                                        "readfile",   "writefile", "fts3_tokenizer"};
  if (name == nullptr) return true;
  for (const char* denied : kDenied)
    if (strcasecmp(name, denied) == 0) return true;
  return false;
}

// Schema changes that no phase of the daemon makes: a trigger or view would outlive the
// statement that made it and run later as the daemon's own.
bool IsNeverAllowed(int action) {
  switch (action) {
    case SQLITE_ATTACH:
    case SQLITE_DETACH:
    case SQLITE_ALTER_TABLE:
    case SQLITE_DROP_INDEX:
    case SQLITE_DROP_TABLE:
    case SQLITE_DROP_TEMP_INDEX:
    case SQLITE_DROP_TEMP_TABLE:
    case SQLITE_DROP_TEMP_TRIGGER:
    case SQLITE_DROP_TEMP_VIEW:
    case SQLITE_DROP_TRIGGER:
    case SQLITE_DROP_VIEW:
    case SQLITE_DROP_VTABLE:
    case SQLITE_CREATE_TEMP_TRIGGER:
    case SQLITE_CREATE_TEMP_VIEW:
    case SQLITE_CREATE_TRIGGER:
    case SQLITE_CREATE_VIEW:
    case SQLITE_CREATE_VTABLE:
      return true;
    default:
      return false;
  }
}

int BusDecision(const char* table, int action, const char* arg1, const char* arg2,
                const char* dbName) {
  bool ownTable = table != nullptr && arg1 != nullptr && strcmp(arg1, table) == 0 &&
                  (dbName == nullptr || strcmp(dbName, "main") == 0);
  switch (action) {
    case SQLITE_SELECT:
      return SQLITE_OK;
    case SQLITE_READ:
    case SQLITE_INSERT:
    case SQLITE_UPDATE:
    case SQLITE_DELETE:
      return ownTable ? SQLITE_OK : SQLITE_DENY;
    case SQLITE_FUNCTION:
      return IsDeniedBusFunction(arg2) ? SQLITE_DENY : SQLITE_OK;
    default:
      // Everything else (ATTACH, DDL, PRAGMA, transactions, VACUUM, recursive queries).
      return SQLITE_DENY;
  }
}

}  // namespace

int AuthorizeAction(StatementScope scope, const char* table, int action, const char* arg1,
                    const char* arg2, const char* dbName) {
  if (scope == StatementScope::kBusRequest) return BusDecision(table, action, arg1, arg2, dbName);
  if (IsNeverAllowed(action)) return SQLITE_DENY;
  // The schema changes only through CREATE (which writes its own row), never by hand: SQLite
  // refuses direct writes to it unless writable_schema is set, which nothing may set.
  if (action == SQLITE_DELETE && IsSchemaTable(arg1)) return SQLITE_DENY;
  if (action == SQLITE_PRAGMA && arg2 != nullptr && arg1 != nullptr &&
      strcasecmp(arg1, "writable_schema") == 0)
    return SQLITE_DENY;
  if (scope == StatementScope::kSetup) return SQLITE_OK;
  switch (action) {
    case SQLITE_CREATE_INDEX:
    case SQLITE_CREATE_TABLE:
    case SQLITE_CREATE_TEMP_INDEX:
    case SQLITE_CREATE_TEMP_TABLE:
      return SQLITE_DENY;
    case SQLITE_PRAGMA:
      return arg2 == nullptr ? SQLITE_OK : SQLITE_DENY;  // reading a pragma is harmless
    case SQLITE_INSERT:
    case SQLITE_UPDATE:
    case SQLITE_DELETE:
      return IsSchemaTable(arg1) ? SQLITE_DENY : SQLITE_OK;
    default:
      return SQLITE_OK;
  }
}

// Blanks as SQLite's tokenizer knows them: a vertical tab is no blank to it.
bool IsOnlyBlanksAndComments(const char* tail) {
  if (tail == nullptr) return true;
  const char* p = tail;
  while (*p != '\0') {
    if (*p == ' ' || *p == '\t' || *p == '\n' || *p == '\r' || *p == '\f') {
      ++p;
    } else if (p[0] == '-' && p[1] == '-') {
      p = strchr(p, '\n');
      if (p == nullptr) return true;
    } else if (p[0] == '/' && p[1] == '*') {
      p = strstr(p + 2, "*/");
      if (p == nullptr) return true;  // SQLite too reads an open comment to the end
      p += 2;
    } else {
      return false;
    }
  }
  return true;
}

}  // namespace _CorvaneLogManager

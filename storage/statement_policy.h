// What a statement may do on a daemon connection, by whose statement it is: the open phase's,
// the daemon's own, or one bus request's. DbConnection's authorizer asks these; they hold no
// state, so a fuzzer or a test can ask them too.
#ifndef LOGMGR_STORAGE_STATEMENT_POLICY_H_
#define LOGMGR_STORAGE_STATEMENT_POLICY_H_

namespace _CorvaneLogManager {

enum class StatementScope {
  // Opening a file and creating its tables: pragmas and CREATE TABLE/INDEX, never DROP, ALTER,
  // ATTACH, triggers or views.
  kSetup,
  // Everything after: rows only. No ATTACH/DETACH, no pragma writes, no schema change.
  kDaemon,
  // One bus request: rows of one table only, no other table, schema, pragma, transaction,
  // recursion or blob-making function.
  kBusRequest,
};

// SQLITE_OK or SQLITE_DENY for one authorizer call. |table| is the bus request's table.
int AuthorizeAction(StatementScope scope, const char* table, int action, const char* arg1,
                    const char* arg2, const char* dbName);

// True when |tail| (what follows a prepared statement) holds only blanks and comments: the
// text was exactly one statement. A second ";" counts as another statement.
bool IsOnlyBlanksAndComments(const char* tail);

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_STORAGE_STATEMENT_POLICY_H_

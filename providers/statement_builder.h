// The statements the providers run, each built in one place into a fixed buffer of
// kStatementSize bytes. The bus guard asks the same builders whether a caller's request comes
// out whole before anything runs.
#ifndef LOGMGR_PROVIDERS_STATEMENT_BUILDER_H_
#define LOGMGR_PROVIDERS_STATEMENT_BUILDER_H_

#include <stddef.h>

#include <string>

namespace _CorvaneLogManager {

// How a statement came out of its buffer.
enum class StatementFit {
  kWhole,     // complete
  kCut,       // cut at the buffer's end; the provider runs the cut text
  kOverflow,  // a list or a clause past its buffer; the provider ends the process
};

// "INSERT INTO table(columns) VALUES (values);" without its terminating NUL.
size_t InsertLength(const std::string& table, size_t columns, size_t values);
StatementFit BuildInsert(const std::string& table, const char* columns, const char* values,
                         char* sql);
// "UPDATE table SET c = v,... WHERE where;": both lists (below kListSize each) cut at
// |splitDelims|, empty pieces skipped, paired in step; a value not starting with a quote is
// quoted.
StatementFit BuildUpdate(const std::string& table, const char* columns, const char* values,
                         const char* where, const char* splitDelims, char* sql);
// "SELECT columns FROM table[ WHERE ..][ GROUP BY ..][ ORDER BY ..];", "*" for null columns.
StatementFit BuildSelect(const std::string& table, const char* columns, const char* where,
                         const char* groupBy, const char* orderBy, char* sql);
StatementFit BuildDelete(const std::string& table, const char* where, char* sql);

// Whether a caller's lists, once the automatic column texts are appended, make a whole
// statement: the insert also copies the caller's column list for its check, so that list must
// stay below kListSize. An update without a where is refused before anything is built, so it
// counts as fitting.
bool InsertStatementFits(const std::string& table, const std::string& columns,
                         const std::string& values, const std::string& autoColumns,
                         const std::string& autoValues);
bool UpdateStatementFits(const std::string& table, const std::string& columns,
                         const std::string& values, const std::string& autoColumns,
                         const std::string& autoValues, const char* where, const char* splitDelims);
bool SelectStatementFits(const std::string& table, const char* columns, const char* where);
bool DeleteStatementFits(const std::string& table, const char* where);

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_PROVIDERS_STATEMENT_BUILDER_H_

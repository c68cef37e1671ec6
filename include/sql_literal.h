// SQL text literals built from values that came from outside the process (platform signals,
// the app database, bus callers). A value is stored verbatim: every "'" is doubled, so the
// text can never end its literal early and become part of the statement.
#ifndef LOGMGR_INCLUDE_SQL_LITERAL_H_
#define LOGMGR_INCLUDE_SQL_LITERAL_H_

#include <stddef.h>

namespace _CorvaneLogManager {

// Appends |text| to the NUL-terminated |out| of |size| bytes with every "'" doubled, stopping
// before a character that would not fit whole. Returns the bytes of |text| taken.
size_t AppendQuoted(char* out, size_t size, const char* text);

// Writes "'" + |text| (quotes doubled) + "'" into |out|. 0 when the whole literal fits, -1
// (and |out| emptied) when it does not: a cut literal would store a different value.
int QuoteLiteral(char* out, size_t size, const char* text);

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_INCLUDE_SQL_LITERAL_H_

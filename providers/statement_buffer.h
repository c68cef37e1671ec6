// Fixed-buffer helpers shared by the providers. Nothing is ever written past a buffer: a list
// or an appended clause that would not fit is reported (the ...Fits helpers, which the
// statement builder uses to answer whether a request fits) or ends the process (...OrDie).
#ifndef LOGMGR_PROVIDERS_STATEMENT_BUFFER_H_
#define LOGMGR_PROVIDERS_STATEMENT_BUFFER_H_

#include <stddef.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

namespace _CorvaneLogManager {

constexpr size_t kStatementSize = 1024;
constexpr size_t kListSize = 200;

// Copies |text| into |buf| (kListSize bytes); false, nothing copied, at 200 characters or more.
inline bool CopyList(char* buf, const char* text) {
  size_t len = strlen(text);
  if (len >= kListSize) return false;
  memcpy(buf, text, len + 1);
  return true;
}

// Copies |text| into |buf| (kListSize bytes); 200 characters or more is fatal.
inline void CopyListOrDie(char* buf, const char* text) {
  if (!CopyList(buf, text)) abort();
}

// Appends |piece| to the NUL-terminated text in |buf| of |size| bytes; false, nothing appended,
// when it does not fit.
inline bool AppendFits(char* buf, size_t size, const char* piece) {
  size_t used = strlen(buf);
  size_t len = strlen(piece);
  if (used + len >= size) return false;
  memcpy(buf + used, piece, len + 1);
  return true;
}

// As AppendFits; not fitting is fatal.
inline void AppendOrDie(char* buf, size_t size, const char* piece) {
  if (!AppendFits(buf, size, piece)) abort();
}

// Formats one clause (|format| holding one %s) with |text| into a statement-sized piece, which
// cuts it, and appends that; nothing when |text| is null. False when it does not fit |buf|.
inline bool AppendClauseFits(char* buf, size_t size, const char* format, const char* text) {
  if (text == nullptr) return true;
  char piece[kStatementSize];
  (void)snprintf(piece, sizeof(piece), format, text);
  return AppendFits(buf, size, piece);
}

// As AppendClauseFits; not fitting is fatal.
inline void AppendClauseOrDie(char* buf, size_t size, const char* format, const char* text) {
  if (!AppendClauseFits(buf, size, format, text)) abort();
}

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_PROVIDERS_STATEMENT_BUFFER_H_

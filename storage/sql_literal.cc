#include "include/sql_literal.h"

#include <string.h>

namespace _CorvaneLogManager {

size_t AppendQuoted(char* out, size_t size, const char* text) {
  size_t used = strlen(out);
  size_t taken = 0;
  for (; text[taken] != '\0'; ++taken) {
    size_t need = text[taken] == '\'' ? 2 : 1;
    if (used + need >= size) break;
    out[used++] = text[taken];
    if (need == 2) out[used++] = '\'';
  }
  out[used] = '\0';
  return taken;
}

int QuoteLiteral(char* out, size_t size, const char* text) {
  if (size < 3) {
    if (size > 0) out[0] = '\0';
    return -1;
  }
  out[0] = '\'';
  out[1] = '\0';
  // One byte kept back for the closing quote.
  size_t taken = AppendQuoted(out, size - 1, text);
  if (text[taken] != '\0') {
    out[0] = '\0';
    return -1;
  }
  size_t used = strlen(out);
  out[used] = '\'';
  out[used + 1] = '\0';
  return 0;
}

}  // namespace _CorvaneLogManager

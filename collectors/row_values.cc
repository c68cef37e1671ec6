#include "collectors/row_values.h"

#include <stdio.h>
#include <string.h>

#include "include/sql_literal.h"

namespace _CorvaneLogManager {

RowValues::RowValues(char* buf, size_t bufSize) : buffer(buf), size(bufSize) {
  if (size > 0) {
    buffer[0] = '\0';
  } else {
    overflow = true;
  }
}

size_t RowValues::StartValue() {
  if (overflow) return 0;
  if (used > 0) {
    if (used + 1 >= size) {
      overflow = true;
      return 0;
    }
    buffer[used++] = ',';
    buffer[used] = '\0';
  }
  return size - used;
}

RowValues& RowValues::Text(const char* text) {
  size_t room = StartValue();
  if (room == 0) return *this;
  if (QuoteLiteral(buffer + used, room, text != nullptr ? text : "") != 0) {
    overflow = true;
    return *this;
  }
  used += strlen(buffer + used);
  return *this;
}

RowValues& RowValues::Number(long long number) {
  size_t room = StartValue();
  if (room == 0) return *this;
  int written = snprintf(buffer + used, room, "%lld", number);
  if (written < 0 || static_cast<size_t>(written) >= room) {
    overflow = true;
    return *this;
  }
  used += static_cast<size_t>(written);
  return *this;
}

}  // namespace _CorvaneLogManager

#include "reporting/row_splitter.h"

#include <string.h>

#include <new>

namespace _CorvaneLogManager {

namespace {
char g_empty[1] = {'\0'};
}  // namespace

char* RowSplitter::Next(char* text, const char* separators, char** cursor) {
  if (cursor == nullptr || separators == nullptr) return g_empty;
  char* start = text != nullptr ? text : *cursor;
  if (start == nullptr || *start == '\0') {
    *cursor = nullptr;
    return g_empty;
  }
  char* end = start + strcspn(start, separators);
  if (*end == '\0') {
    *cursor = end;
  } else {
    *end = '\0';
    *cursor = end + 1;
  }
  return start;
}

char** RowSplitter::SplitRows(char** rows, int rowCount, int fields) {
  if (rows == nullptr || rowCount <= 0 || fields <= 0) return nullptr;
  char** out = new (std::nothrow) char*[static_cast<size_t>(rowCount) * fields];
  if (out == nullptr) return nullptr;
  for (int r = 0; r < rowCount; ++r) {
    char* cursor = nullptr;
    char** row = out + static_cast<size_t>(r) * fields;
    row[0] = Next(rows[r], ",", &cursor);
    for (int f = 1; f < fields; ++f) row[f] = Next(nullptr, ",", &cursor);
  }
  return out;
}

}  // namespace _CorvaneLogManager

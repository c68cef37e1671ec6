// RowValues: the values text of a collector's insert ("'a','b',12"), built in the caller's
// fixed buffer. Texts come from outside the process (signals, the app database), so each is
// stored verbatim as a quoted literal, and a row that does not fit whole is refused: a cut
// value would be a different value.
#ifndef LOGMGR_COLLECTORS_ROW_VALUES_H_
#define LOGMGR_COLLECTORS_ROW_VALUES_H_

#include <stddef.h>

namespace _CorvaneLogManager {

class RowValues {
 public:
  RowValues(char* buffer, size_t size);

  RowValues& Text(const char* text);
  RowValues& Number(long long number);
  // The values text, or null when any value did not fit.
  const char* Get() const { return overflow ? nullptr : buffer; }

 private:
  // Room left for the next value once its separating comma is written; 0 when none.
  size_t StartValue();

  char* buffer;
  size_t size;
  size_t used = 0;
  bool overflow = false;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_COLLECTORS_ROW_VALUES_H_

// RowSplitter: the one tokenizer for select row texts ("col1,col2,...,", every column followed
// by a comma). Unlike strtok it yields an empty token between consecutive commas, on purpose:
// a row's fields keep their positions even when a column is empty.
#ifndef LOGMGR_REPORTING_ROW_SPLITTER_H_
#define LOGMGR_REPORTING_ROW_SPLITTER_H_

namespace _CorvaneLogManager {

class RowSplitter {
 public:
  // Next token of |text| (null: continue from |*cursor|) up to the first character of
  // |separators|, which is overwritten with a terminator; |*cursor| moves past it. At the end
  // of the text, or with an empty text or cursor, returns a shared empty text, never null.
  // The shared text must not be written to.
  static char* Next(char* text, const char* separators, char** cursor);

  // Splits each of |rowCount| row texts in place at "," into |fields| pointers, stored row after
  // row in one new[] array (the caller delete[]s it; the pointers point into the rows).
  // Null when |rowCount| or |fields| is not positive or the allocation fails.
  static char** SplitRows(char** rows, int rowCount, int fields);
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_REPORTING_ROW_SPLITTER_H_

// A query's rows as one text, so that a test compares what a database file holds in one
// assertion. Free of GoogleTest, like temp_sysroot.h.
#ifndef LOGMGR_TESTS_SQLITE_ROWS_H_
#define LOGMGR_TESTS_SQLITE_ROWS_H_

#include <sqlite3.h>

#include <string>

// The rows of |sql| on the database file |path|, opened read-only: columns joined by |sep|, each
// row ended by ';', NULL written as |null|; "<error>" when the file or statement cannot be had.
inline std::string FileRows(const std::string& path, const std::string& sql, const char* sep = ":",
                            const char* null = "") {
  sqlite3* db = nullptr;
  sqlite3_stmt* stmt = nullptr;
  std::string out;
  if (sqlite3_open_v2(path.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK ||
      sqlite3_prepare_v2(db, sql.c_str(), -1, &stmt, nullptr) != SQLITE_OK)
    out = "<error>";
  while (stmt != nullptr && sqlite3_step(stmt) == SQLITE_ROW) {
    for (int i = 0; i < sqlite3_column_count(stmt); ++i) {
      const unsigned char* text = sqlite3_column_text(stmt, i);
      out += (i > 0 ? sep : "") + std::string(text ? reinterpret_cast<const char*>(text) : null);
    }
    out += ';';
  }
  sqlite3_finalize(stmt);
  sqlite3_close(db);
  return out;
}

// |text| as an SQL string literal, its quotes doubled: a fixture's own statement takes any text.
inline std::string SqlQuoted(const std::string& text) {
  std::string out = "'";
  for (char c : text) out += c == '\'' ? "''" : std::string(1, c);
  return out + "'";
}

#endif  // LOGMGR_TESTS_SQLITE_ROWS_H_

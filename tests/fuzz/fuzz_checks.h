// Properties the fuzz targets hold the parsers to, shared with the unit test that replays the
// committed corpora in every build. Each check returns "" when all hold, else what broke.
#ifndef LOGMGR_TESTS_FUZZ_FUZZ_CHECKS_H_
#define LOGMGR_TESTS_FUZZ_FUZZ_CHECKS_H_

#include <math.h>
#include <stdint.h>
#include <string.h>
#include <vconf.h>

#include <algorithm>
#include <memory>
#include <string>
#include <vector>

#include "platform/host/vconf_store.h"
#include "providers/provider_bus_guard.h"
#include "providers/statement_buffer.h"
#include "providers/statement_builder.h"
#include "reporting/row_splitter.h"

namespace fuzz_checks {

using _CorvaneLogManager::BusRowLists;
using _CorvaneLogManager::kListSize;
using _CorvaneLogManager::kStatementSize;
using _CorvaneLogManager::RowSplitter;

// Split at any of |seps| keeping empty pieces (or dropping them, as strtok does).
inline std::vector<std::string> Split(const std::string& text, const std::string& seps,
                                      bool keepEmpty = true) {
  std::vector<std::string> out(1);
  for (char c : text) {
    if (seps.find(c) == std::string::npos) {
      out.back() += c;
    } else if (keepEmpty || !out.back().empty()) {
      out.emplace_back();
    }
  }
  if (!keepEmpty && out.back().empty()) out.pop_back();
  return out;
}

// Input: fields count, separator count and separators, then the text (rows split at '\n').
inline std::string CheckRowSplitter(const uint8_t* data, size_t size) {
  if (size < 2) return "";
  const int fields = 1 + data[0] % 8;
  const size_t sepCount = data[1] % 4;
  if (2 + sepCount > size) return "";
  std::string seps;
  for (size_t i = 0; i < sepCount; ++i)
    if (data[2 + i] != 0) seps += static_cast<char>(data[2 + i]);
  std::string text(reinterpret_cast<const char*>(data) + 2 + sepCount, size - 2 - sepCount);
  text = text.substr(0, text.find('\0'));

  // Next: tokens lie back to back in the text, each ended by one separator, and match a plain
  // split except that an empty piece after the last separator is not reported.
  std::vector<char> buf(text.begin(), text.end());
  buf.push_back('\0');
  std::vector<std::string> expected = Split(text, seps);
  if (expected.back().empty()) expected.pop_back();
  std::vector<std::string> got;
  std::string rejoined;
  char* cursor = nullptr;
  for (size_t n = 0;; ++n) {
    if (n > text.size() + 1) return "Next never reaches the end";
    char* token = RowSplitter::Next(n == 0 ? buf.data() : nullptr, seps.c_str(), &cursor);
    if (token == nullptr) return "Next returned null";
    if (cursor == nullptr) {
      if (*token != '\0') return "the end is not an empty text";
      break;
    }
    if (token < buf.data() || token >= buf.data() + buf.size()) return "token outside the text";
    size_t at = static_cast<size_t>(token - buf.data());
    size_t length = strlen(token);
    if (at != rejoined.size()) return "token does not start after the previous separator";
    got.emplace_back(token, length);
    rejoined.append(token, length);
    if (at + length < text.size()) rejoined += text[at + length];
  }
  if (rejoined != text) return "tokens and separators rejoined differ from the input";
  if (got != expected) return "tokens differ from a plain split";
  char* after = RowSplitter::Next(nullptr, seps.c_str(), &cursor);
  if (after == nullptr || *after != '\0' || cursor != nullptr) return "the end is not sticky";
  char* unused = nullptr;
  if (RowSplitter::Next(buf.data(), nullptr, &unused) == nullptr ||
      RowSplitter::Next(buf.data(), seps.c_str(), nullptr) == nullptr)
    return "Next returned null for a missing argument";

  // SplitRows: field f of row r is the f-th comma piece of the row, or empty past its end.
  std::vector<std::string> lines = Split(text, "\n");
  std::vector<std::unique_ptr<char[]>> storage;
  std::vector<char*> rows;
  for (const std::string& line : lines) {
    storage.emplace_back(new char[line.size() + 1]);
    memcpy(storage.back().get(), line.c_str(), line.size() + 1);
    rows.push_back(storage.back().get());
  }
  const int rowCount = static_cast<int>(rows.size());
  if (RowSplitter::SplitRows(rows.data(), 0, fields) != nullptr ||
      RowSplitter::SplitRows(rows.data(), rowCount, 0) != nullptr)
    return "SplitRows split nothing into something";
  std::unique_ptr<char*[]> out(RowSplitter::SplitRows(rows.data(), rowCount, fields));
  if (out == nullptr) return "SplitRows returned null";
  for (int r = 0; r < rowCount; ++r) {
    std::vector<std::string> pieces = Split(lines[r], ",");
    for (int f = 0; f < fields; ++f) {
      const char* field = out[static_cast<size_t>(r) * fields + f];
      std::string want = static_cast<size_t>(f) < pieces.size() ? pieces[f] : "";
      if (field == nullptr) return "SplitRows left a null field";
      if (want != field)
        return "row " + std::to_string(r) + " field " + std::to_string(f) + " is \"" + field +
               "\", not \"" + want + "\"";
    }
  }
  return "";
}

// The two tables outside callers write through the bus. The fuzz target is built without the
// providers, so it carries this copy; the replay test holds it to the providers' own table.
struct BusTableShape {
  const char* name;
  const char* columnList;
};
inline const BusTableShape kBusTables[] = {
    {"use_app_feature_survey", "_id,timestamp,time_zone,app_id,feature,extra,value"},
    {"report_app_status_survey", "_id,timestamp,time_zone,app_id,feature,extra,value"},
};

// What the provider does with a request: refuses it before building a statement, builds every
// statement whole, or overflows a buffer (a cut statement or an abort).
enum class Built { kRefused, kWhole, kOverflow };

inline Built Whole(const std::string& statement) {
  return statement.size() < kStatementSize ? Built::kWhole : Built::kOverflow;
}

inline Built BuildInsert(const std::string& table, const BusRowLists& lists,
                         const BusRowLists& autoTexts) {
  if (lists.columns.empty() || lists.values.empty()) return Built::kRefused;
  if (lists.columns.size() >= kListSize) return Built::kOverflow;  // the column check's copy
  return Whole("INSERT INTO " + table + "(" + lists.columns + autoTexts.columns + ") VALUES (" +
               lists.values + autoTexts.values + ");");
}

inline Built BuildUpdate(const std::string& table, const BusRowLists& lists,
                         const BusRowLists& autoTexts, const char* where) {
  if (lists.columns.empty() || lists.values.empty() || where == nullptr) return Built::kRefused;
  std::string columns = lists.columns + autoTexts.columns;
  std::string values = lists.values + autoTexts.values;
  if (columns.size() >= kListSize || values.size() >= kListSize) return Built::kOverflow;
  // Both lists are cut at commas, empty pieces skipped, and paired in step.
  std::vector<std::string> cols = Split(columns, ",", false);
  std::vector<std::string> vals = Split(values, ",", false);
  std::string set;
  for (size_t i = 0; i < cols.size() && i < vals.size(); ++i) {
    set += cols[i] + " = " + (vals[i][0] == '\'' ? vals[i] : "'" + vals[i] + "'") + ",";
    if (set.size() >= kStatementSize) return Built::kOverflow;
  }
  if (!set.empty()) set.pop_back();
  return Whole("UPDATE " + table + " SET " + set + " WHERE " + where + ";");
}

inline Built BuildSelect(const std::string& table, const std::string& columns, const char* where) {
  return Whole("SELECT " + columns + " FROM " + table +
               (where != nullptr ? std::string(" WHERE ") + where : "") + ";");
}

// An accepted request never overflows, and a refused one would not have been built whole.
inline std::string Agree(const char* what, bool fits, Built built) {
  if (fits && built == Built::kOverflow) return std::string(what) + " accepted but overflows";
  if (!fits && built == Built::kWhole) return std::string(what) + " refused but fits";
  return "";
}

// An _id a caller may give: decimal digits only, from 1 to 2^53.
inline bool CallerRowIdAllowed(const std::string& value) {
  if (value.empty() || value.find_first_not_of("0123456789") != std::string::npos) return false;
  std::string digits = value.substr(std::min(value.find_first_not_of('0'), value.size()));
  if (digits.empty() || digits.size() > 16) return false;
  return std::stoull(digits) <= (1ULL << 53);
}

// Input: table byte, separator byte, then fields split at the separator: the time zone name,
// select columns, a where text, then row_data keys and values. A one-byte key names a declared
// column by index, so the fuzzer reaches the accepted paths without guessing names.
inline std::string CheckBusGuard(const uint8_t* data, size_t size) {
  if (size < 2) return "";
  const BusTableShape& shape = kBusTables[data[0] % 2];
  const std::string table = shape.name;
  std::string rest(reinterpret_cast<const char*>(data) + 2, size - 2);
  std::vector<std::string> parts = Split(rest, std::string(1, static_cast<char>(data[1])));
  for (std::string& part : parts) part = part.substr(0, part.find('\0'));
  parts.resize(std::max<size_t>(parts.size(), 3));
  const std::vector<std::string> declared = Split(shape.columnList, ",");

  BusRowLists autoTexts;
  autoTexts.columns = ",timestamp";
  autoTexts.values = ",1700000000000";
  if (!parts[0].empty()) {
    autoTexts.columns += ",time_zone";
    autoTexts.values += ",'" + parts[0] + "'";
  }

  BusRowLists lists;
  std::vector<std::string> acceptedKeys;
  std::vector<std::string> acceptedValues;
  std::string appId;
  std::string feature;
  for (size_t i = 3; i + 1 < parts.size(); i += 2) {
    std::string key = parts[i];
    if (key.size() == 1) key = declared[static_cast<uint8_t>(key[0]) % declared.size()];
    const std::string& value = parts[i + 1];
    bool allowed = key != "timestamp" && key != "time_zone" &&
                   value.find('\'') == std::string::npos &&
                   (key != "_id" || CallerRowIdAllowed(value));
    bool known = false;
    for (const std::string& column : declared) known = known || column == key;
    BusRowLists before = lists;
    int result = _CorvaneLogManager::AppendRowEntry(declared, key.c_str(), value.c_str(), &lists);
    if ((result == 0) != (allowed && known)) return "entry for key \"" + key + "\" misjudged";
    if (result != 0) {
      if (lists.columns != before.columns || lists.values != before.values)
        return "a refused entry changed the lists";
      continue;
    }
    acceptedKeys.push_back(key);
    acceptedValues.push_back("'" + value + "'");
    if (value.find(',') != std::string::npos && !lists.valueHasComma)
      return "a comma in a value went unnoticed";
    if (key == "app_id") appId = value;
    if (key == "feature") feature = value;
  }
  std::string columns;
  std::string values;
  for (size_t i = 0; i < acceptedKeys.size(); ++i) {
    columns += (i > 0 ? "," : "") + acceptedKeys[i];
    values += (i > 0 ? "," : "") + acceptedValues[i];
  }
  if (lists.columns != columns || lists.values != values)
    return "lists differ from the accepted entries";

  using namespace _CorvaneLogManager;
  std::string failed = Agree(
      "insert",
      InsertStatementFits(table, lists.columns, lists.values, autoTexts.columns, autoTexts.values),
      BuildInsert(table, lists, autoTexts));
  // Wheres: none, the caller's text, and the upsert's (app_id, feature) condition.
  std::vector<const char*> wheres = {nullptr, parts[2].c_str()};
  std::string condition = "app_id='" + appId + "' and feature='" + feature + "'";
  wheres.push_back(condition.c_str());
  for (const char* where : wheres) {
    if (failed.empty())
      failed = Agree("update",
                     UpdateStatementFits(table, lists.columns, lists.values, autoTexts.columns,
                                         autoTexts.values, where, ","),
                     BuildUpdate(table, lists, autoTexts, where));
    if (failed.empty())
      failed = Agree("select", SelectStatementFits(table, parts[1].c_str(), where),
                     BuildSelect(table, parts[1], where));
    if (failed.empty() && where != nullptr)
      failed = Agree("delete", DeleteStatementFits(table, where),
                     Whole("DELETE FROM " + table + " WHERE " + where + ";"));
  }
  return failed;
}

inline bool SameValue(const vconf_store::Value& a, const vconf_store::Value& b) {
  if (a.type != b.type) return false;
  switch (a.type) {
    case VCONF_TYPE_BOOL:
    case VCONF_TYPE_INT:
      return a.i == b.i;
    case VCONF_TYPE_DOUBLE:
      return isnan(a.d) ? isnan(b.d) : a.d == b.d && signbit(a.d) == signbit(b.d);
    case VCONF_TYPE_STRING:
      return a.s == b.s;
    default:
      return false;
  }
}

// Render |v| and parse it back: the value a later read gets must be the one written.
inline std::string ReadsBack(const vconf_store::Value& v, const char* what) {
  std::string text;
  if (!vconf_store::Render(v, &text)) return std::string(what) + " cannot be rendered";
  vconf_store::Value back;
  if (!vconf_store::Parse(text.data(), text.size(), &back))
    return std::string(what) + " renders as unreadable \"" + text + "\"";
  if (!SameValue(v, back)) return std::string(what) + " reads back changed from \"" + text + "\"";
  return "";
}

// Input: a key file's bytes; also (from 9 bytes on) a value to store: type from the first byte,
// the number from the next eight, the string from the rest.
inline std::string CheckVconfStore(const uint8_t* data, size_t size) {
  const char* text = reinterpret_cast<const char*>(data);
  vconf_store::Value parsed;
  parsed.type = -1;
  bool ok = vconf_store::Parse(text, size, &parsed);
  if (!ok && parsed.type != -1) return "a refused text changed the value";
  if (ok) {
    std::string failed = ReadsBack(parsed, "a parsed value");
    if (!failed.empty()) return failed;
  }
  if (size < 9) return "";
  static const int kTypes[] = {VCONF_TYPE_BOOL, VCONF_TYPE_INT, VCONF_TYPE_DOUBLE,
                               VCONF_TYPE_STRING};
  vconf_store::Value stored;
  stored.type = kTypes[data[0] % 4];
  memcpy(&stored.i, data + 1, sizeof stored.i);
  if (stored.type == VCONF_TYPE_BOOL) stored.i &= 1;  // the setter stores 0 or 1
  memcpy(&stored.d, data + 1, sizeof stored.d);
  stored.s.assign(text + 9, size - 9);
  std::string rendered;
  bool storable = stored.s.find_first_of(std::string("\n\0", 2)) == std::string::npos ||
                  stored.type != VCONF_TYPE_STRING;
  if (vconf_store::Render(stored, &rendered) != storable) return "storable value misjudged";
  return storable ? ReadsBack(stored, "a stored value") : "";
}

}  // namespace fuzz_checks

#endif  // LOGMGR_TESTS_FUZZ_FUZZ_CHECKS_H_

#include "storage/pref_store.h"

#include <limits.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <new>

#include "include/db_connection.h"
#include "include/sql_literal.h"
#include "platform/fixed_path.h"

namespace _CorvaneLogManager {

namespace {

const char kDbPath[] = "/opt/usr/dbspace/.pref.db";
const char kTable[] = "pref";
const char kCreateSql[] =
    "CREATE TABLE IF NOT EXISTS pref(pref_key TEXT PRIMARY KEY, pref_data TEXT);";
const char kDeviceIdKey[] = "key_deviceid";
const char kLastShutdownKey[] = "key_last_shutdown_time";
const char kReportDateKey[] = "key_report_date";
const char kSurveyUpdateDateKey[] = "key_survey_update_date";
const char kSentDateKey[] = "key_sent_date";
const char kDeleteDateKey[] = "key_delete_date";

const char kAlphabet[] = "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789";
const int kAlphabetSize = 62;
const int kFirstCharIndex = 45;
const size_t kRandomChars = 12;
const size_t kTimeDigits = 13;
const size_t kBodyLength = 1 + kRandomChars + kTimeDigits;  // what the suffix covers
const size_t kIdLength = kBodyLength + 6;

std::string g_deviceId;

// The check suffix of the 26-character body; see pref_store.h for the layout.
void CheckSuffix(const unsigned char* c, char out[6]) {
  out[0] = static_cast<char>('A' + (c[1] + c[5] + (c[13] & 0x0F) + (c[20] & 0x0F)) % 26);
  out[1] = static_cast<char>('a' + (c[2] + (c[7] & 0xF0) + (c[14] & 0x0F) + (c[25] & 0x0F)) % 26);
  out[2] = static_cast<char>('0' + (c[3] + (c[9] & 0xFE) + (c[15] & 0x0F) + (c[16] & 0x0F)) % 10);
  out[3] = static_cast<char>(
      '0' + (c[4] + c[11] + (c[17] & 0x0F) + (c[18] & 0x0F) + (c[24] & 0x0F)) % 10);
  out[4] = static_cast<char>('A' +
                             (c[0] + c[6] + (c[10] & 0xF0) + (c[19] & 0x0F) + (c[21] & 0x0F)) % 26);
  out[5] = static_cast<char>('a' + (c[8] + (c[12] & 0xFE) + (c[22] & 0x0F) + (c[23] & 0x0F)) % 26);
}

std::string NewDeviceId() {
  srand(static_cast<unsigned>(time(nullptr)));
  char random[kRandomChars];
  for (size_t i = 0; i < kRandomChars; ++i) random[i] = kAlphabet[rand() % kAlphabetSize];
  return MakeDeviceId(random, time(nullptr));
}

}  // namespace

const std::string& CachedDeviceId() { return g_deviceId; }

std::string MakeDeviceId(const char random[12], time_t seconds) {
  char digits[32];
  (void)snprintf(digits, sizeof(digits), "%ld", static_cast<long>(seconds));
  size_t len = strlen(digits);
  std::string id(1, kAlphabet[kFirstCharIndex]);
  id.append(random, kRandomChars);
  // Left-padded with zeros to 13 digits. A longer text keeps only what follows its first 13
  // digits (deliberate, unreachable before year 318857); the body is then padded back.
  if (len <= kTimeDigits) {
    id.append(kTimeDigits - len, '0');
    id.append(digits, len);
  } else {
    id.append(digits + kTimeDigits);
  }
  id.resize(kBodyLength, '0');
  char suffix[6];
  CheckSuffix(reinterpret_cast<const unsigned char*>(id.data()), suffix);
  id.append(suffix, sizeof(suffix));
  return id;
}

bool VerifyDeviceId(const std::string& id) {
  size_t len = id.size();
  if (len == kIdLength + 1 && id[kIdLength] == ',') len = kIdLength;
  if (len != kIdLength || id[0] != kAlphabet[kFirstCharIndex]) return false;
  for (size_t i = 1; i <= kRandomChars; ++i) {
    if (strchr(kAlphabet, id[i]) == nullptr || id[i] == '\0') return false;
  }
  for (size_t i = 1 + kRandomChars; i < kBodyLength; ++i) {
    if (id[i] < '0' || id[i] > '9') return false;
  }
  char suffix[6];
  CheckSuffix(reinterpret_cast<const unsigned char*>(id.data()), suffix);
  return memcmp(suffix, id.data() + kBodyLength, sizeof(suffix)) == 0;
}

PrefStore::PrefStore() = default;

PrefStore::~PrefStore() = default;

int PrefStore::Create() {
  if (connection != nullptr) return Open();
  connection.reset(new (std::nothrow) DbConnection());
  if (connection == nullptr) return -1;
  if (Open() == 0) return 0;
  (void)connection->Close();
  connection.reset();
  return -1;
}

int PrefStore::Close() {
  if (connection == nullptr) return -1;
  int rc = connection->Close();
  connection.reset();
  return rc;
}

int PrefStore::Open() {
  if (connection == nullptr) return -1;
  char path[PATH_MAX];
  if (connection->Open(logmgr_fixed_path(kDbPath, path, sizeof(path))) != 0) return -1;
  // The device id's first write belongs to the open too: a second process opening the store
  // at the same moment holds the lock briefly, and the open waits for it instead of failing.
  DbConnection::SetupScope setup(connection.get());
  if (connection->Exec(kCreateSql) != 0) return -1;
  std::string id;
  if (GetString(kDeviceIdKey, &id) != 0) return -1;
  if (id.empty()) {
    id = NewDeviceId();
    if (SetString(kDeviceIdKey, id.c_str()) != 0) return -1;
  }
  g_deviceId = id;
  return 0;
}

int PrefStore::SetString(const char* key, const char* value) {
  if (key == nullptr || key[0] == '\0' || connection == nullptr) return -1;
  char keyLiteral[512];
  char valueLiteral[4096];
  if (QuoteLiteral(keyLiteral, sizeof(keyLiteral), key) != 0 ||
      QuoteLiteral(valueLiteral, sizeof(valueLiteral), value != nullptr ? value : "") != 0)
    return -1;
  char sql[sizeof(keyLiteral) + sizeof(valueLiteral) + 64];
  (void)snprintf(sql, sizeof(sql), "INSERT OR REPLACE INTO %s VALUES(%s,%s);", kTable, keyLiteral,
                 valueLiteral);
  return connection->Exec(sql);
}

int PrefStore::SetInt64(const char* key, int64_t value) {
  char text[4096];
  (void)snprintf(text, sizeof(text), "%lld", static_cast<long long>(value));
  return SetString(key, text);
}

int PrefStore::GetString(const char* key, std::string* value) {
  if (key == nullptr || key[0] == '\0' || value == nullptr || connection == nullptr) return -1;
  char keyLiteral[512];
  if (QuoteLiteral(keyLiteral, sizeof(keyLiteral), key) != 0) return -1;
  char sql[1024];
  (void)snprintf(sql, sizeof(sql), "SELECT %s FROM %s WHERE %s=%s;", "pref_data", kTable,
                 "pref_key", keyLiteral);
  QueryRows rows;
  int rc = connection->Select(sql, kTable, &rows.count, &rows.rows);
  value->clear();
  if (rc == 0 && rows.count == 1) *value = rows[0];  // trailing comma kept on purpose
  return rc;
}

int PrefStore::GetInt64(const char* key, int64_t* value) {
  if (value == nullptr) return -1;
  std::string text;
  int rc = GetString(key, &text);
  // The row's trailing comma ends the number.
  *value = text.empty() ? 0 : static_cast<int64_t>(strtoll(text.c_str(), nullptr, 10));
  return rc;
}

int PrefStore::SetDeleteDate(int64_t ms) { return SetInt64(kDeleteDateKey, ms); }

int64_t PrefStore::GetDeleteDate() {
  int64_t value = 0;
  return GetInt64(kDeleteDateKey, &value) == 0 ? value : -1;
}

int PrefStore::SetSurveyUpdateDate(int32_t date) { return SetInt64(kSurveyUpdateDateKey, date); }

int32_t PrefStore::GetSurveyUpdateDate() {
  int64_t value = 0;
  return GetInt64(kSurveyUpdateDateKey, &value) == 0 ? static_cast<int32_t>(value) : -1;
}

int PrefStore::SetReportDate(int32_t date) { return SetInt64(kReportDateKey, date); }

int32_t PrefStore::GetReportDate() {
  int64_t value = 0;
  return GetInt64(kReportDateKey, &value) == 0 ? static_cast<int32_t>(value) : -1;
}

int PrefStore::SetSentDate(int32_t seconds) { return SetInt64(kSentDateKey, seconds); }

uint32_t PrefStore::GetSentDate() {
  int64_t value = 0;
  return GetInt64(kSentDateKey, &value) == 0 ? static_cast<uint32_t>(value) : 0;
}

int PrefStore::SetLastShutdownTime(int32_t seconds) { return SetInt64(kLastShutdownKey, seconds); }

uint32_t PrefStore::GetLastShutdownTime() {
  int64_t value = 0;
  return GetInt64(kLastShutdownKey, &value) == 0 ? static_cast<uint32_t>(value) : 0;
}

uint32_t PrefStore::NormaliseSentDate() {
  uint32_t sent = GetSentDate();
  time_t when = static_cast<time_t>(sent);
  struct tm local;
  if (localtime_r(&when, &local) == nullptr) return 0;
  if (local.tm_hour == 0) return sent;  // minutes and seconds deliberately not looked at
  if (local.tm_hour > 12) local.tm_mday += 1;
  local.tm_hour = 0;
  local.tm_min = 0;
  local.tm_sec = 0;
  local.tm_isdst = -1;  // the midnight may lie on the other side of a DST change
  time_t midnight = mktime(&local);
  (void)SetSentDate(static_cast<int32_t>(midnight));
  return static_cast<uint32_t>(midnight);
}

}  // namespace _CorvaneLogManager

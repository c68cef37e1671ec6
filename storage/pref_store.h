// PrefStore: the daemon's few persistent values (device id, report dates, last shutdown) as
// texts in the key/value table "pref" of /opt/usr/dbspace/.pref.db.
#ifndef LOGMGR_STORAGE_PREF_STORE_H_
#define LOGMGR_STORAGE_PREF_STORE_H_

#include <stdint.h>
#include <time.h>

#include <memory>
#include <string>

namespace _CorvaneLogManager {

class DbConnection;

// The device id as loaded or made by the last successful Create; empty before. A loaded id
// keeps the trailing comma of its row text; a freshly made one has none.
const std::string& CachedDeviceId();

// Device id: 32 characters c[0..31]. c[0] = 'T', c[1..12] random letters and digits,
// c[13..25] the creation time in seconds as 13 decimal digits, c[26..31] a check suffix
// over c[0..25] (masks: "& 0x0F" keeps a digit's value, "& 0xF0" a letter's case/half,
// "& 0xFE" drops the low bit):
//   c[26] 'A' + (c1 + c5 + c13&0x0F + c20&0x0F) % 26
//   c[27] 'a' + (c2 + c7&0xF0 + c14&0x0F + c25&0x0F) % 26
//   c[28] '0' + (c3 + c9&0xFE + c15&0x0F + c16&0x0F) % 10
//   c[29] '0' + (c4 + c11 + c17&0x0F + c18&0x0F + c24&0x0F) % 10
//   c[30] 'A' + (c0 + c6 + c10&0xF0 + c19&0x0F + c21&0x0F) % 26
//   c[31] 'a' + (c8 + c12&0xFE + c22&0x0F + c23&0x0F) % 26
// Every time digit takes part with its full value, so any single changed digit is caught.
std::string MakeDeviceId(const char random[12], time_t seconds);
// True for a well-formed id whose suffix matches; one trailing comma (as read back) is allowed.
bool VerifyDeviceId(const std::string& id);

class PrefStore {
 public:
  PrefStore();
  // Frees the connection object; closing it is Close's.
  ~PrefStore();

  // Allocates the connection and opens the store. 0 / -1.
  int Create();
  // Closes the connection and frees it. 0 / -1.
  int Close();
  // Opens the file, creates the table, loads or makes the device id. 0 / -1.
  int Open();

  // Keys and values go into the statement unescaped: they are the daemon's own texts.
  int SetString(const char* key, const char* value);
  int SetInt64(const char* key, int64_t value);
  // An absent key reads as 0 / "" with success. A text keeps its trailing comma (deliberate).
  int GetInt64(const char* key, int64_t* value);
  int GetString(const char* key, std::string* value);

  // Getters return the value; on failure -1 for these three...
  int SetDeleteDate(int64_t ms);
  int64_t GetDeleteDate();
  int SetSurveyUpdateDate(int32_t date);
  int32_t GetSurveyUpdateDate();
  int SetReportDate(int32_t date);
  int32_t GetReportDate();
  // ...and 0 for these two.
  int SetSentDate(int32_t seconds);
  uint32_t GetSentDate();
  int SetLastShutdownTime(int32_t seconds);
  uint32_t GetLastShutdownTime();
  // Rounds key_sent_date to the nearest local midnight (12:xx rounds down), stores it back and
  // returns it; a sent date at hour 0 is returned as it is; 0 when it cannot be converted.
  uint32_t NormaliseSentDate();

 private:
  std::unique_ptr<DbConnection> connection;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_STORAGE_PREF_STORE_H_

// One local day of the device as the daemon recorded it: read-only from its databases and the
// relay outbox under the sysroot, placed on the day's wall clock.
#ifndef LOGMGR_TOOLS_LOGMGRCTL_DAY_DATA_H_
#define LOGMGR_TOOLS_LOGMGRCTL_DAY_DATA_H_

#include <stdint.h>

#include <string>
#include <utility>
#include <vector>

#include "tools/logmgrctl/day_layout.h"

namespace daypage {

// A bar: a foreground or device-status period, clipped to the day.
struct Period {
  std::string lane;   // package id, or a feature code
  std::string extra;  // the feature's extra (charger kind, Bluetooth class)
  std::string zone;   // the zone its times are shown in
  Span shown;         // clipped to the day
  Span full;          // as recorded
  int64_t recordedMs;
  bool open;  // still open in the status store: |full.end| is the latest known time
};

// A point in time: package event, crash, unlock, capture, battery level, another caller's row.
struct Mark {
  enum Kind {
    kInstall,
    kUninstall,
    kUpdate,
    kPackage,
    kCrash,
    kUnlock,
    kCapture,
    kPlug,
    kUnplug,
    kRow
  };
  Kind kind;
  std::string lane;  // for kRow: the calling app; otherwise empty
  std::string text;  // what it is about: package, app, battery level, row fields
  std::string zone;
  int64_t at;
};

// A report record, handed to the relay or still queued.
struct Record {
  int number;  // place in the outbox or the queue
  int rank;    // hand-over rank of its activity (lower goes first), 9 for unknown ones
  std::string activity;
  std::string when;                                         // hand-over or queueing time
  std::vector<std::pair<std::string, std::string>> fields;  // the body without its header
};

struct Identity {
  std::string model, firmware, mcc, mnc;
};

struct DayData {
  int64_t dayStart = 0;
  std::string zone;  // the device's zone, which the date is read in
  Identity identity;
  std::vector<Period> apps;    // foreground periods, oldest first
  std::vector<Period> device;  // SCRN, CHAR, HEAD, WIFI, BLUE (and CONN) periods
  std::vector<Mark> marks;
  // Foreground time per app, largest first; from the relay records when the day's rows have
  // already been condensed and removed.
  std::vector<std::pair<std::string, int64_t>> foreground;
  bool foregroundFromRecords = false;
  std::vector<Record> relayed;
  std::vector<Record> queued;  // of this day
  int queuedTotal = 0;         // of every day

  bool Empty() const {
    return apps.empty() && device.empty() && marks.empty() && relayed.empty() && queued.empty();
  }
};

// The device's zone from its time-zone link; empty when unknown.
std::string DeviceZone();

// Reads the day |date| ("YYYY-MM-DD", empty for today in the device's zone). Returns 0, 2 for a
// malformed date, 3 when the survey database cannot be read; the one-line reason goes to
// |problem|.
int LoadDay(const std::string& date, DayData* day, std::string* problem);

// Feature codes of the device lanes, in drawing order, with what they mean.
struct DeviceLane {
  const char* code;
  const char* meaning;
};
extern const DeviceLane kDeviceLanes[6];

const char* MarkName(Mark::Kind kind);
const char* ActivityName(const std::string& activity);  // "001" is "app use", ...

}  // namespace daypage

#endif  // LOGMGR_TOOLS_LOGMGRCTL_DAY_DATA_H_

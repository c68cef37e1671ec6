// DeviceIdentity: the SIM operator codes, model and firmware build that head every daily report.
#ifndef LOGMGR_REPORTING_DEVICE_IDENTITY_H_
#define LOGMGR_REPORTING_DEVICE_IDENTITY_H_

#include <stdlib.h>

#include <memory>

namespace _CorvaneLogManager {

class DeviceIdentity {
 public:
  DeviceIdentity() = default;
  ~DeviceIdentity() = default;
  DeviceIdentity(const DeviceIdentity&) = delete;
  DeviceIdentity& operator=(const DeviceIdentity&) = delete;

  // Re-reads the operator codes every time (the SIM may change); model and firmware only
  // while they are still unknown. The result is that of the last read performed. 0 / -1.
  int Refresh();

  // Null while unknown.
  const char* Mcc() const { return mcc.get(); }
  const char* Mnc() const { return mnc.get(); }
  const char* Model() const { return model.get(); }
  const char* Firmware() const { return firmware.get(); }

  // A text the platform allocated, released with free().
  struct FreeText {
    void operator()(char* text) const { free(text); }
  };
  using PlatformText = std::unique_ptr<char, FreeText>;

 private:
  int ReadOperator();

  std::unique_ptr<char[]> mcc;  // 3 characters
  std::unique_ptr<char[]> mnc;  // 2 or 3 characters
  PlatformText firmware;
  PlatformText model;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_REPORTING_DEVICE_IDENTITY_H_

// DeviceIdentity: the SIM operator codes, model and firmware build that head every daily report.
#ifndef LOGMGR_REPORTING_DEVICE_IDENTITY_H_
#define LOGMGR_REPORTING_DEVICE_IDENTITY_H_

namespace _CorvaneLogManager {

class DeviceIdentity {
 public:
  DeviceIdentity() = default;
  ~DeviceIdentity();
  DeviceIdentity(const DeviceIdentity&) = delete;
  DeviceIdentity& operator=(const DeviceIdentity&) = delete;

  // Re-reads the operator codes every time (the SIM may change); model and firmware only
  // while they are still unknown. The result is that of the last read performed. 0 / -1.
  int Refresh();

  // Null while unknown.
  const char* Mcc() const { return mcc; }
  const char* Mnc() const { return mnc; }
  const char* Model() const { return model; }
  const char* Firmware() const { return firmware; }

 private:
  int ReadOperator();

  char* mcc = nullptr;       // 3 characters, new[]
  char* mnc = nullptr;       // 2 or 3 characters, new[]
  char* firmware = nullptr;  // from the platform, free()
  char* model = nullptr;     // from the platform, free()
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_REPORTING_DEVICE_IDENTITY_H_

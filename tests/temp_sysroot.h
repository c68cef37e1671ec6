// A fresh temporary sysroot for one test: LOGMGR_SYSROOT points at it while the object lives,
// and it goes, with everything beneath it, when the object does.
#ifndef LOGMGR_TESTS_TEMP_SYSROOT_H_
#define LOGMGR_TESTS_TEMP_SYSROOT_H_

#include <stdio.h>
#include <stdlib.h>

#include <string>

class TempSysroot {
 public:
  explicit TempSysroot(const char* tag) {
    std::string tmpl = std::string("/tmp/logmgr-") + tag + "-XXXXXX";
    if (mkdtemp(&tmpl[0]) == nullptr) {
      perror("mkdtemp");
      abort();
    }
    path_ = tmpl;
    setenv("LOGMGR_SYSROOT", path_.c_str(), 1);
  }
  ~TempSysroot() {
    unsetenv("LOGMGR_SYSROOT");
    // Tests may leave read-only directories behind; make them removable first.
    (void)system(("chmod -R u+w '" + path_ + "' 2>/dev/null; rm -rf '" + path_ + "'").c_str());
  }
  TempSysroot(const TempSysroot&) = delete;
  TempSysroot& operator=(const TempSysroot&) = delete;

  const std::string& path() const { return path_; }

 private:
  std::string path_;
};

#endif  // LOGMGR_TESTS_TEMP_SYSROOT_H_

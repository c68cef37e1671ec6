// A fresh temporary sysroot for one test or benchmark: LOGMGR_SYSROOT points at it while the
// object lives, and it goes, with everything beneath it, when the object does. Free of
// GoogleTest so that benchmarks and fuzz harnesses can use it too.
#ifndef LOGMGR_TESTS_TEMP_SYSROOT_H_
#define LOGMGR_TESTS_TEMP_SYSROOT_H_

#include <errno.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <initializer_list>
#include <string>

class TempSysroot {
 public:
  // |dirs| are made beneath the root right away, e.g. {"/opt/usr/dbspace", "/etc"}.
  explicit TempSysroot(const char* tag, std::initializer_list<const char*> dirs = {}) {
    std::string tmpl = std::string("/tmp/logmgr-") + tag + "-XXXXXX";
    if (mkdtemp(&tmpl[0]) == nullptr) Fail("mkdtemp");
    path_ = tmpl;
    setenv("LOGMGR_SYSROOT", path_.c_str(), 1);
    for (const char* dir : dirs)
      if (!MakeDir(dir)) Fail(dir);
  }
  ~TempSysroot() {
    unsetenv("LOGMGR_SYSROOT");
    // Tests may leave read-only directories behind; make them removable first.
    (void)system(("chmod -R u+w '" + path_ + "' 2>/dev/null; rm -rf '" + path_ + "'").c_str());
  }
  TempSysroot(const TempSysroot&) = delete;
  TempSysroot& operator=(const TempSysroot&) = delete;

  const std::string& path() const { return path_; }
  std::string Path(const std::string& rel) const { return path_ + rel; }

  // mkdir -p of |rel| under the root.
  bool MakeDir(const std::string& rel) const {
    std::string full = path_ + rel;
    for (size_t at = path_.size() + 1; at <= full.size(); ++at) {
      if (at != full.size() && full[at] != '/') continue;
      if (mkdir(full.substr(0, at).c_str(), 0755) != 0 && errno != EEXIST) return false;
    }
    return true;
  }

  // Writes |content| to |rel| under the root, making its directory first.
  bool Write(const std::string& rel, const std::string& content) const {
    size_t slash = rel.rfind('/');
    if (slash != std::string::npos && slash > 0 && !MakeDir(rel.substr(0, slash))) return false;
    FILE* f = fopen(Path(rel).c_str(), "w");
    if (f == nullptr) return false;
    bool ok = fwrite(content.data(), 1, content.size(), f) == content.size();
    return fclose(f) == 0 && ok;
  }

  // Points /opt/etc/localtime at |zone| (a zoneinfo path); an empty |zone| leaves no link.
  bool SetLocaltime(const std::string& zone) const {
    std::string link = Path("/opt/etc/localtime");
    (void)unlink(link.c_str());
    return zone.empty() || (MakeDir("/opt/etc") && symlink(zone.c_str(), link.c_str()) == 0);
  }

 private:
  [[noreturn]] static void Fail(const char* what) {
    perror(what);
    abort();
  }
  std::string path_;
};

#endif  // LOGMGR_TESTS_TEMP_SYSROOT_H_

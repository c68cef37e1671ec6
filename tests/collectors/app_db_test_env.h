// App collector fixture: the survey database through the real registry, an app database, and
// real processes running copies of sleep.
#ifndef LOGMGR_TESTS_COLLECTORS_APP_DB_TEST_ENV_H_
#define LOGMGR_TESTS_COLLECTORS_APP_DB_TEST_ENV_H_

#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/sched.h>
#include <signal.h>
#include <sqlite3.h>
#include <stdlib.h>
#include <string.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "include/provider_registry.h"
#include "storage/db_manager.h"
#include "tests/sqlite_rows.h"
#include "tests/temp_sysroot.h"

namespace _CorvaneLogManager {

class AppDbTest : public ::testing::Test {
 protected:
  void SetUp() override {
    unsetenv("DISPLAY");                        // the tests drive the monitors directly, without X
    setenv("ECORE_NO_SYSTEM_MODULES", "1", 1);  // they would look for a system bus
    ASSERT_EQ(
        Sh("mkdir -p '" + sysroot + "/opt/usr/dbspace' '" + sysroot + "/opt/dbspace' '" + sysroot +
           "/opt/etc' && ln -s /usr/share/zoneinfo/UTC '" + sysroot + "/opt/etc/localtime'"),
        0);
    ASSERT_EQ(ProviderRegistry::GetInstance()->CreateProviders(), 0);
    ASSERT_EQ(DbManager::GetInstance()->Init(), 0);
    ASSERT_EQ(AppDb("CREATE TABLE package_app_info(app_id TEXT PRIMARY KEY, package TEXT NOT NULL,"
                    " app_exec TEXT NOT NULL)"),
              SQLITE_OK);
  }
  void TearDown() override {
    for (pid_t pid : children) {
      kill(pid, SIGKILL);
      waitpid(pid, nullptr, 0);
    }
    ProviderRegistry::Release();
    DbManager::CloseInstance();
  }

  static int Sh(const std::string& cmd) { return system(cmd.c_str()); }

  int AppDb(const std::string& sql) {
    sqlite3* db = nullptr;
    int rc = sqlite3_open((sysroot + "/opt/dbspace/.pkgmgr_parser.db").c_str(), &db);
    if (rc == SQLITE_OK) rc = sqlite3_exec(db, sql.c_str(), nullptr, nullptr, nullptr);
    sqlite3_close(db);
    return rc;
  }

  // Installs |appId| with a copy of sleep at |exec| (a device path); ids are taken verbatim.
  void Install(const std::string& appId, const std::string& package, const std::string& exec) {
    std::string file = sysroot + exec;
    ASSERT_EQ(Sh("mkdir -p \"$(dirname '" + file + "')\" && cp -n /usr/bin/sleep '" + file + "'"),
              0);
    ASSERT_EQ(AppDb("INSERT INTO package_app_info VALUES (" + SqlQuoted(appId) + "," +
                    SqlQuoted(package) + ",'" + exec + "')"),
              SQLITE_OK);
  }

  // Starts the executable at device path |exec|, as process |pid| if one is given (free, and
  // ours to choose with CAP_SYS_ADMIN); returns once the exec has happened, or -1.
  pid_t Run(const std::string& exec, pid_t pid = 0) {
    std::string file = sysroot + exec;
    int fds[2];
    if (pipe2(fds, O_CLOEXEC) != 0) return -1;
    struct clone_args args;
    memset(&args, 0, sizeof(args));
    args.exit_signal = SIGCHLD;
    args.set_tid = reinterpret_cast<uintptr_t>(&pid);
    args.set_tid_size = 1;
    long child = pid != 0 ? syscall(SYS_clone3, &args, sizeof(args)) : fork();
    if (child == 0) {
      execl(file.c_str(), file.c_str(), "infinity", static_cast<char*>(nullptr));
      _exit(127);
    }
    close(fds[1]);
    char c;
    if (child > 0) (void)read(fds[0], &c, 1);  // end of file: the exec closed the pipe
    close(fds[0]);
    if (child <= 0) return -1;
    children.push_back(static_cast<pid_t>(child));
    return static_cast<pid_t>(child);
  }

  std::string Rows(const std::string& sql) {
    return FileRows(sysroot + "/opt/usr/dbspace/.SurveyLog.db", sql);
  }

  TempSysroot tmp{"apps"};
  const std::string sysroot = tmp.path();
  std::vector<pid_t> children;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_TESTS_COLLECTORS_APP_DB_TEST_ENV_H_

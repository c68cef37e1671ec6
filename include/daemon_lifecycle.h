// The daemon's process entry and its three ways to end: consent withdrawn, power-off, signal.
#ifndef LOGMGR_INCLUDE_DAEMON_LIFECYCLE_H_
#define LOGMGR_INCLUDE_DAEMON_LIFECYCLE_H_

namespace _CorvaneLogManager {

// The whole life of the daemon process. Returns 0 or -1 (exit status 0 or 255).
int RunDaemon();

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_INCLUDE_DAEMON_LIFECYCLE_H_

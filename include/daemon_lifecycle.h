// The daemon's process entry and its three ways to end: consent withdrawn, power-off, signal.
#ifndef LOGMGR_INCLUDE_DAEMON_LIFECYCLE_H_
#define LOGMGR_INCLUDE_DAEMON_LIFECYCLE_H_

namespace _CorvaneLogManager {

// The whole life of the daemon process. Returns 0 or -1 (exit status 0 or 255).
int RunDaemon();

// Runs when a report job ends, on the worker: the job body, then the consent check. A
// withdrawn consent ends the process through SIGTERM, so the stop runs on the main loop.
int RecheckConsentAfterJob();

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_INCLUDE_DAEMON_LIFECYCLE_H_

// `logmgrctl outbox`: shows what the daemon has handed over to the relay library.
#ifndef LOGMGR_TOOLS_LOGMGRCTL_OUTBOX_VIEW_H_
#define LOGMGR_TOOLS_LOGMGRCTL_OUTBOX_VIEW_H_

// argv[0] is "outbox"; returns the process exit code.
int RunOutboxCommand(int argc, char** argv);

#endif  // LOGMGR_TOOLS_LOGMGRCTL_OUTBOX_VIEW_H_

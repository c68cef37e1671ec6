// `logmgrctl day [DATE] [--html FILE]`: one local day of the device, as aligned text or as a
// self-contained HTML page.
#ifndef LOGMGR_TOOLS_LOGMGRCTL_DAY_VIEW_H_
#define LOGMGR_TOOLS_LOGMGRCTL_DAY_VIEW_H_

// argv[0] is "day"; returns the process exit code.
int RunDayCommand(int argc, char** argv);

#endif  // LOGMGR_TOOLS_LOGMGRCTL_DAY_VIEW_H_

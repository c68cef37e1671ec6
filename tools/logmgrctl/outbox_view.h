// `logmgrctl outbox`: shows what the daemon has handed over to the relay library.
#ifndef LOGMGR_TOOLS_LOGMGRCTL_OUTBOX_VIEW_H_
#define LOGMGR_TOOLS_LOGMGRCTL_OUTBOX_VIEW_H_

#include <map>
#include <string>

// argv[0] is "outbox"; returns the process exit code.
int RunOutboxCommand(int argc, char** argv);

// One outbox line, the flat object the relay writes: item number -> text (numbers kept as
// their digits). false on malformed text.
bool ParseOutboxRecord(const std::string& line, std::map<int, std::string>* items);

#endif  // LOGMGR_TOOLS_LOGMGRCTL_OUTBOX_VIEW_H_

// logmgrctl: insert, update, select and delete on the daemon's two shared tables over the
// system bus, and read-only views of its databases.
#include <dbus/dbus.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ipc.h>
#include <sys/shm.h>

#include <string>
#include <utility>
#include <vector>

#include "tools/logmgrctl/day_view.h"
#include "tools/logmgrctl/outbox_view.h"
#include "tools/logmgrctl/table_view.h"

namespace {

constexpr char kBusName[] = "com.corvane.logmgr";
constexpr char kPathPrefix[] = "/com/corvane/logmgr/log/provider/";
constexpr char kInterfacePrefix[] = "com.corvane.logmgr.log.provider.";

enum ExitCode { kOk = 0, kFailed = 1, kUsage = 2, kUnreachable = 3 };

// Every table holds at most this many rows (its limit plus one check interval before trimming),
// and a cell of a result row is at most this long with its comma.
constexpr size_t kMaxTableRows = 5500;
constexpr size_t kMaxCellBytes = 300;
constexpr size_t kTableColumns = 7;

const char kUsageText[] =
    "usage: logmgrctl COMMAND ...\n"
    "  insert TABLE COLUMN=VALUE...            add a row (report_app_status_survey: replace\n"
    "                                          the row of the same app_id and feature)\n"
    "  update TABLE --where WHERE COLUMN=VALUE...\n"
    "  select TABLE COLUMNS [--size BYTES]     every row of the table, one per line\n"
    "  delete TABLE --where WHERE\n"
    "  show TABLE [--limit N]                  newest rows of any log table (read-only)\n"
    "  queue [--limit N]                       the upload queue (read-only)\n"
    "  outbox                                  records handed to the relay library\n"
    "  day [DATE] [--html FILE]                one local day (YYYY-MM-DD, default today):\n"
    "                                          apps, device status, events, relay records;\n"
    "                                          as text, or as a self-contained HTML page\n"
    "TABLE for insert/update/select/delete: use_app_feature_survey or report_app_status_survey.\n"
    "show TABLE: use_app_survey, manage_app_survey, report_app_error_survey,\n"
    "  use_app_feature_survey, report_app_status_survey, survey_log.\n"
    "Exit status: 0 done, 1 the daemon refused or failed the request, 2 usage error,\n"
    "  3 the bus or a database cannot be reached.\n";

int Usage(const char* problem) {
  fprintf(stderr, "logmgrctl: %s (see logmgrctl --help)\n", problem);
  return kUsage;
}

bool IsSharedTable(const char* table) {
  return strcmp(table, "use_app_feature_survey") == 0 ||
         strcmp(table, "report_app_status_survey") == 0;
}

bool ParseCount(const char* text, long* out) {
  char* end = nullptr;
  long value = strtol(text, &end, 10);
  if (end == text || *end != '\0' || value < 0) return false;
  *out = value;
  return true;
}

// Arguments after TABLE: "--where W", "--size N", "--limit N" and COLUMN=VALUE pairs.
struct Options {
  const char* where = nullptr;
  long size = -1;
  long limit = 20;
  std::vector<std::pair<std::string, std::string>> row;
  std::vector<const char*> plain;
};

bool ParseOptions(int argc, char** argv, int first, Options* options, std::string* problem) {
  for (int i = first; i < argc; ++i) {
    const char* arg = argv[i];
    bool takesValue =
        strcmp(arg, "--where") == 0 || strcmp(arg, "--size") == 0 || strcmp(arg, "--limit") == 0;
    if (takesValue) {
      if (i + 1 >= argc) {
        *problem = std::string(arg) + " needs a value";
        return false;
      }
      const char* value = argv[++i];
      if (strcmp(arg, "--where") == 0) {
        options->where = value;
      } else if (!ParseCount(value,
                             strcmp(arg, "--size") == 0 ? &options->size : &options->limit)) {
        *problem = std::string(arg) + " needs a non-negative number";
        return false;
      }
    } else if (strncmp(arg, "--", 2) == 0) {
      *problem = std::string("unknown option ") + arg;
      return false;
    } else if (const char* eq = strchr(arg, '='); eq != nullptr && eq != arg) {
      options->row.emplace_back(std::string(arg, eq - arg), std::string(eq + 1));
    } else {
      options->plain.push_back(arg);
    }
  }
  return true;
}

class BusCall {
 public:
  BusCall(const char* table, const char* method) {
    std::string path = std::string(kPathPrefix) + table;
    std::string iface = std::string(kInterfacePrefix) + table;
    message = dbus_message_new_method_call(kBusName, path.c_str(), iface.c_str(), method);
    dbus_message_iter_init_append(message, &args);
    dbus_error_init(&error);
  }
  ~BusCall() {
    if (reply != nullptr) dbus_message_unref(reply);
    if (message != nullptr) dbus_message_unref(message);
    dbus_error_free(&error);
  }

  void AddString(const char* value) {
    dbus_message_iter_append_basic(&args, DBUS_TYPE_STRING, &value);
  }
  void AddUint32(dbus_uint32_t value) {
    dbus_message_iter_append_basic(&args, DBUS_TYPE_UINT32, &value);
  }
  void AddRow(const std::vector<std::pair<std::string, std::string>>& row) {
    DBusMessageIter dict;
    dbus_message_iter_open_container(&args, DBUS_TYPE_ARRAY, "{ss}", &dict);
    for (const auto& [key, value] : row) {
      DBusMessageIter entry;
      const char* k = key.c_str();
      const char* v = value.c_str();
      dbus_message_iter_open_container(&dict, DBUS_TYPE_DICT_ENTRY, nullptr, &entry);
      dbus_message_iter_append_basic(&entry, DBUS_TYPE_STRING, &k);
      dbus_message_iter_append_basic(&entry, DBUS_TYPE_STRING, &v);
      dbus_message_iter_close_container(&dict, &entry);
    }
    dbus_message_iter_close_container(&args, &dict);
  }

  // Sends and waits; an exit code with the one-line message already printed.
  int Send(const char* what) {
    DBusConnection* bus = dbus_bus_get(DBUS_BUS_SYSTEM, &error);
    if (bus == nullptr) {
      fprintf(stderr, "logmgrctl: cannot reach the system bus: %s\n", error.message);
      return kUnreachable;
    }
    reply = dbus_connection_send_with_reply_and_block(bus, message, -1, &error);
    dbus_connection_unref(bus);
    if (reply != nullptr) return kOk;
    bool absent = dbus_error_has_name(&error, DBUS_ERROR_SERVICE_UNKNOWN) ||
                  dbus_error_has_name(&error, DBUS_ERROR_NAME_HAS_NO_OWNER) ||
                  dbus_error_has_name(&error, DBUS_ERROR_NO_REPLY);
    fprintf(stderr, "logmgrctl: %s failed: %s\n", what,
            error.message != nullptr ? error.message : error.name);
    return absent ? kUnreachable : kFailed;
  }

  // The int32 out argument of Insert, Update and Delete.
  bool ReplyInt(dbus_int32_t* value) {
    return dbus_message_get_args(reply, &error, DBUS_TYPE_INT32, value, DBUS_TYPE_INVALID);
  }

 private:
  DBusMessage* message = nullptr;
  DBusMessage* reply = nullptr;
  DBusMessageIter args;
  DBusError error;
};

int PrintIntReply(BusCall* call, const char* what) {
  int code = call->Send(what);
  if (code != kOk) return code;
  dbus_int32_t value = 0;
  if (!call->ReplyInt(&value)) {
    fprintf(stderr, "logmgrctl: %s failed: unexpected reply\n", what);
    return kFailed;
  }
  printf("%d\n", value);
  return kOk;
}

int RunInsert(const char* table, const Options& options) {
  if (options.row.empty()) return Usage("insert needs COLUMN=VALUE pairs");
  if (!options.plain.empty() || options.where != nullptr)
    return Usage("insert takes only COLUMN=VALUE pairs");
  BusCall call(table, "Insert");
  call.AddRow(options.row);
  return PrintIntReply(&call, "insert");
}

int RunUpdate(const char* table, const Options& options) {
  if (options.where == nullptr) return Usage("update needs --where");
  if (options.row.empty() || !options.plain.empty())
    return Usage("update needs COLUMN=VALUE pairs");
  BusCall call(table, "Update");
  call.AddRow(options.row);
  call.AddString(options.where);
  return PrintIntReply(&call, "update");
}

int RunDelete(const char* table, const Options& options) {
  if (options.where == nullptr) return Usage("delete needs --where");
  if (!options.row.empty() || !options.plain.empty()) return Usage("delete takes only --where");
  BusCall call(table, "Delete");
  call.AddString(options.where);
  return PrintIntReply(&call, "delete");
}

// Room for every row the table can hold with the requested columns, each cell at its longest.
size_t SegmentSizeFor(const char* columns) {
  size_t count = 1;
  for (const char* p = columns; *p != '\0'; ++p) count += *p == ',';
  if (strcmp(columns, "*") == 0) count = kTableColumns;
  return kMaxTableRows * (count * kMaxCellBytes + 1) + 1;
}

// Prints the rows the daemon wrote: texts each ended by a NUL, then "&". false when the end
// mark is missing (nothing was written).
bool PrintSegment(const char* base, size_t size) {
  std::vector<std::string> rows;
  size_t pos = 0;
  while (pos < size) {
    if (base[pos] == '&' && (pos + 1 == size || base[pos + 1] == '\0')) {
      for (std::string& row : rows) {
        if (!row.empty() && row.back() == ',') row.pop_back();
        printf("%s\n", row.c_str());
      }
      return true;
    }
    const void* nul = memchr(base + pos, '\0', size - pos);
    if (nul == nullptr) return false;
    size_t end = static_cast<const char*>(nul) - base;
    rows.emplace_back(base + pos, end - pos);
    pos = end + 1;
  }
  return false;
}

int RunSelect(const char* table, const Options& options) {
  if (options.plain.size() != 1 || !options.row.empty() || options.where != nullptr)
    return Usage("select needs COLUMNS (and optionally --size)");
  const char* columns = options.plain[0];
  size_t size = options.size > 0 ? static_cast<size_t>(options.size) : SegmentSizeFor(columns);
  int shmId = shmget(IPC_PRIVATE, size, IPC_CREAT | 0600);
  if (shmId == -1) {
    perror("logmgrctl: cannot create the shared-memory segment");
    return kFailed;
  }
  void* base = shmat(shmId, nullptr, SHM_RDONLY);
  // Marked for removal now: it goes away with the last detach, whatever happens below.
  (void)shmctl(shmId, IPC_RMID, nullptr);
  if (base == reinterpret_cast<void*>(-1)) {
    perror("logmgrctl: cannot attach the shared-memory segment");
    return kFailed;
  }
  BusCall call(table, "Select");
  call.AddString(columns);
  call.AddString("");
  call.AddString("");
  call.AddUint32(static_cast<dbus_uint32_t>(shmId));
  int code = call.Send("select");
  if (code == kOk && !PrintSegment(static_cast<const char*>(base), size)) {
    fprintf(stderr, "logmgrctl: select failed: the daemon wrote no result\n");
    code = kFailed;
  }
  (void)shmdt(base);
  return code;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 2) return Usage("missing command");
  const char* command = argv[1];
  if (strcmp(command, "--help") == 0 || strcmp(command, "-h") == 0 ||
      strcmp(command, "help") == 0) {
    fputs(kUsageText, stdout);
    return kOk;
  }
  if (strcmp(command, "outbox") == 0) return RunOutboxCommand(argc - 1, argv + 1);
  if (strcmp(command, "day") == 0) return RunDayCommand(argc - 1, argv + 1);

  bool queue = strcmp(command, "queue") == 0;
  int first = queue ? 2 : 3;
  if (!queue && argc < 3) return Usage((std::string(command) + " needs a TABLE").c_str());
  Options options;
  std::string problem;
  if (!ParseOptions(argc, argv, first, &options, &problem)) return Usage(problem.c_str());
  if (queue) {
    if (!options.plain.empty() || !options.row.empty()) return Usage("queue takes only --limit");
    return ShowQueue(options.limit);
  }
  const char* table = argv[2];
  if (strcmp(command, "show") == 0) {
    if (!options.plain.empty() || !options.row.empty()) return Usage("show takes only --limit");
    return ShowTable(table, options.limit);
  }

  struct Command {
    const char* name;
    int (*run)(const char*, const Options&);
  };
  static const Command kCommands[] = {
      {"insert", RunInsert}, {"update", RunUpdate}, {"select", RunSelect}, {"delete", RunDelete}};
  for (const Command& entry : kCommands) {
    if (strcmp(command, entry.name) != 0) continue;
    if (!IsSharedTable(table))
      return Usage((std::string("unknown shared table '") + table + "'").c_str());
    return entry.run(table, options);
  }
  return Usage((std::string("unknown command '") + command + "'").c_str());
}

// vconftool: set, get and unset vconf keys of the (simulated) device.
#include <stdio.h>
#include <string.h>
#include <vconf.h>

#include <string>

#include "platform/host/vconf_store.h"

namespace {

int Usage(FILE* out, int status) {
  fprintf(out,
          "usage: vconftool set -t bool|int|double|string KEY VALUE\n"
          "       vconftool get KEY\n"
          "       vconftool unset KEY\n"
          "Keys live under $LOGMGR_SYSROOT when it is set.\n");
  return status;
}

int Fail(const char* fmt, const char* arg) {
  fprintf(stderr, "vconftool: ");
  fprintf(stderr, fmt, arg);
  fprintf(stderr, "\n");
  return 1;
}

int Set(int argc, char** argv) {
  // vconftool set -t TYPE KEY VALUE ["-f" accepted and ignored: every set overwrites]
  const char* type_name = nullptr;
  const char* key = nullptr;
  const char* value = nullptr;
  for (int i = 2; i < argc; ++i) {
    if (strcmp(argv[i], "-t") == 0 && i + 1 < argc) {
      type_name = argv[++i];
    } else if (strcmp(argv[i], "-f") == 0) {
      continue;
    } else if (key == nullptr) {
      key = argv[i];
    } else if (value == nullptr) {
      value = argv[i];
    } else {
      return Fail("unexpected argument '%s'", argv[i]);
    }
  }
  if (type_name == nullptr) return Fail("%s", "set needs -t TYPE");
  if (key == nullptr || value == nullptr) return Fail("%s", "set needs KEY and VALUE");
  int type = vconf_store::TypeFromName(type_name);
  if (type == 0) return Fail("unknown type '%s' (bool, int, double or string)", type_name);
  std::string line = std::string(type_name) + " " + value;
  vconf_store::Value v;
  if (!vconf_store::Parse(line.data(), line.size(), &v)) {
    return Fail("bad value for its type: '%s'", value);
  }
  std::string path;
  if (!vconf_store::KeyPath(key, &path)) {
    return Fail("bad key '%s' (must start with db/, file/ or memory/)", key);
  }
  if (vconf_store::Write(key, v) != VCONF_OK) return Fail("cannot write key '%s'", key);
  return 0;
}

int Get(int argc, char** argv) {
  if (argc != 3) return Fail("%s", "get needs exactly one KEY");
  vconf_store::Value v;
  int rc = vconf_store::Read(argv[2], &v);
  if (rc == VCONF_ERROR_WRONG_PREFIX) return Fail("bad key '%s'", argv[2]);
  if (rc == VCONF_ERROR_FILE_NO_ENT) return Fail("no such key '%s'", argv[2]);
  if (rc != VCONF_OK) return Fail("cannot read key '%s'", argv[2]);
  switch (v.type) {
    case VCONF_TYPE_DOUBLE:
      printf("%.17g\n", v.d);
      break;
    case VCONF_TYPE_STRING:
      printf("%s\n", v.s.c_str());
      break;
    default:
      printf("%d\n", v.i);
      break;
  }
  return 0;
}

int Unset(int argc, char** argv) {
  if (argc != 3) return Fail("%s", "unset needs exactly one KEY");
  std::string path;
  if (!vconf_store::KeyPath(argv[2], &path)) return Fail("bad key '%s'", argv[2]);
  if (vconf_unset(argv[2]) != VCONF_OK) return Fail("no such key '%s'", argv[2]);
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 2) return Usage(stderr, 1);
  std::string cmd = argv[1];
  if (cmd == "-h" || cmd == "--help" || cmd == "help") return Usage(stdout, 0);
  if (cmd == "set") return Set(argc, argv);
  if (cmd == "get") return Get(argc, argv);
  if (cmd == "unset") return Unset(argc, argv);
  return Fail("unknown command '%s' (set, get or unset)", argv[1]);
}

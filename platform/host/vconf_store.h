// The host vconf key-file format, shared by the library, vconftool and the fuzzer.
#ifndef LOGMGR_HOST_VCONF_STORE_H_
#define LOGMGR_HOST_VCONF_STORE_H_

#include <stddef.h>

#include <string>

namespace vconf_store {

struct Value {
  int type = 0;  // VCONF_TYPE_*
  int i = 0;     // int and bool
  double d = 0;
  std::string s;
};

// Parses "<type> <value>" with an optional trailing newline. Returns false on anything else:
// unknown type, a bool other than 0/1, a number with trailing garbage or out of range.
bool Parse(const char* text, size_t len, Value* out);

// Renders |v| as one line ending in a newline. Returns false if it cannot be stored
// (a string holding a newline or a NUL would not read back).
bool Render(const Value& v, std::string* out);

// Maps a key to its file: "db/" and "file/" under /opt/var/kdb, "memory/" under /var/run,
// both beneath the sysroot. Returns false for another prefix or a key with "." or ".." parts.
bool KeyPath(const char* key, std::string* path);

// Reads and parses a key. Returns VCONF_OK or a negative VCONF_ERROR_* code.
int Read(const char* key, Value* out);

// Writes atomically (temp file + rename), making the directories. VCONF_OK or negative.
int Write(const char* key, const Value& v);

// Creates the directories above |file_path|. 0 or -1.
int MakeParentDirs(const std::string& file_path);

// Type names as the CLI and the file use them ("bool", "int", "double", "string"); 0 if unknown.
int TypeFromName(const char* name);
const char* TypeName(int type);

}  // namespace vconf_store

#endif  // LOGMGR_HOST_VCONF_STORE_H_

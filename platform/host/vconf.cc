// vconf on files: get/set through vconf_store, change notification through inotify on the
// key's directory (the file itself is replaced by rename on every set), dispatched from a
// GIOChannel watch on the GLib default main context.
#include <glib.h>
#include <stdlib.h>
#include <string.h>
#include <sys/inotify.h>
#include <unistd.h>
#include <vconf.h>

#include <algorithm>
#include <map>
#include <string>
#include <vector>

#include "platform/host/vconf_store.h"

namespace {

struct Watcher {
  std::string key;
  vconf_callback_fn cb;
  void* data;
};

struct Notifier {
  int fd = -1;
  guint source = 0;
  std::map<int, std::string> key_dir_by_wd;  // inotify wd → key prefix ("memory/pm")
  std::vector<Watcher> watchers;
};

Notifier& TheNotifier() {
  static Notifier* n = new Notifier();  // lives as long as the process; callbacks may run late
  return *n;
}

void Dispatch(const std::string& key) {
  Notifier& n = TheNotifier();
  std::vector<Watcher> matching;
  for (const Watcher& w : n.watchers) {
    if (w.key == key) matching.push_back(w);
  }
  if (matching.empty()) return;
  vconf_store::Value v;
  if (vconf_store::Read(key.c_str(), &v) != VCONF_OK) return;  // removed or garbage: skip
  for (const Watcher& w : matching) {
    // A callback may unregister others (shutdown does): only call those still registered.
    bool still = false;
    for (const Watcher& cur : n.watchers) {
      if (cur.key == w.key && cur.cb == w.cb && cur.data == w.data) still = true;
    }
    if (!still) continue;
    keynode_t node = {};
    node.keyname = const_cast<char*>(key.c_str());
    node.type = v.type;
    if (v.type == VCONF_TYPE_STRING) {
      node.value.s = const_cast<char*>(v.s.c_str());
    } else if (v.type == VCONF_TYPE_DOUBLE) {
      node.value.d = v.d;
    } else {
      node.value.i = v.i;
    }
    w.cb(&node, w.data);
  }
}

gboolean OnInotify(GIOChannel*, GIOCondition, gpointer) {
  Notifier& n = TheNotifier();
  alignas(struct inotify_event) char buf[4096];
  ssize_t len = read(n.fd, buf, sizeof buf);
  if (len <= 0) return TRUE;
  std::vector<std::string> keys;
  for (char* p = buf; p < buf + len;) {
    auto* ev = reinterpret_cast<struct inotify_event*>(p);
    p += sizeof(struct inotify_event) + ev->len;
    if (ev->len == 0) continue;
    auto it = n.key_dir_by_wd.find(ev->wd);
    if (it == n.key_dir_by_wd.end()) continue;
    keys.push_back(it->second + "/" + ev->name);
  }
  for (const std::string& k : keys) Dispatch(k);
  return TRUE;
}

int EnsureWatch(const char* key) {
  Notifier& n = TheNotifier();
  if (n.fd < 0) {
    n.fd = inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
    if (n.fd < 0) return -1;
    GIOChannel* ch = g_io_channel_unix_new(n.fd);
    n.source = g_io_add_watch(ch, G_IO_IN, OnInotify, nullptr);
    g_io_channel_unref(ch);
  }
  std::string path;
  if (!vconf_store::KeyPath(key, &path)) return -1;
  if (vconf_store::MakeParentDirs(path) != 0) return -1;
  std::string dir = path.substr(0, path.rfind('/'));
  int wd = inotify_add_watch(n.fd, dir.c_str(), IN_MOVED_TO | IN_CLOSE_WRITE);
  if (wd < 0) return -1;
  std::string k(key);
  n.key_dir_by_wd[wd] = k.substr(0, k.rfind('/'));
  return 0;
}

int SetValue(const char* key, vconf_store::Value v) {
  return vconf_store::Write(key, v) == VCONF_OK ? VCONF_OK : VCONF_ERROR;
}

int GetTyped(const char* key, int type, vconf_store::Value* v) {
  if (key == nullptr) return VCONF_ERROR;
  if (vconf_store::Read(key, v) != VCONF_OK || v->type != type) return VCONF_ERROR;
  return VCONF_OK;
}

}  // namespace

extern "C" {

int vconf_set_int(const char* in_key, const int intval) {
  vconf_store::Value v;
  v.type = VCONF_TYPE_INT;
  v.i = intval;
  return SetValue(in_key, v);
}

int vconf_set_bool(const char* in_key, const int boolval) {
  vconf_store::Value v;
  v.type = VCONF_TYPE_BOOL;
  v.i = boolval != 0;
  return SetValue(in_key, v);
}

int vconf_set_dbl(const char* in_key, const double dblval) {
  vconf_store::Value v;
  v.type = VCONF_TYPE_DOUBLE;
  v.d = dblval;
  return SetValue(in_key, v);
}

int vconf_set_str(const char* in_key, const char* strval) {
  if (strval == nullptr) return VCONF_ERROR;
  vconf_store::Value v;
  v.type = VCONF_TYPE_STRING;
  v.s = strval;
  return SetValue(in_key, v);
}

int vconf_get_int(const char* in_key, int* intval) {
  vconf_store::Value v;
  if (intval == nullptr || GetTyped(in_key, VCONF_TYPE_INT, &v) != VCONF_OK) return VCONF_ERROR;
  *intval = v.i;
  return VCONF_OK;
}

int vconf_get_bool(const char* in_key, int* boolval) {
  vconf_store::Value v;
  if (boolval == nullptr || GetTyped(in_key, VCONF_TYPE_BOOL, &v) != VCONF_OK) return VCONF_ERROR;
  *boolval = v.i;
  return VCONF_OK;
}

int vconf_get_dbl(const char* in_key, double* dblval) {
  vconf_store::Value v;
  if (dblval == nullptr || GetTyped(in_key, VCONF_TYPE_DOUBLE, &v) != VCONF_OK) {
    return VCONF_ERROR;
  }
  *dblval = v.d;
  return VCONF_OK;
}

char* vconf_get_str(const char* in_key) {
  vconf_store::Value v;
  if (GetTyped(in_key, VCONF_TYPE_STRING, &v) != VCONF_OK) return nullptr;
  return strdup(v.s.c_str());
}

int vconf_unset(const char* in_key) {
  std::string path;
  if (!vconf_store::KeyPath(in_key, &path)) return VCONF_ERROR;
  return unlink(path.c_str()) == 0 ? VCONF_OK : VCONF_ERROR;
}

int vconf_notify_key_changed(const char* in_key, vconf_callback_fn cb, void* user_data) {
  if (in_key == nullptr || cb == nullptr) return VCONF_ERROR;
  // The same registration again is accepted but kept once: a caller retrying its start at
  // every idle turn must not grow the list (and the work of every change) without bound.
  for (const Watcher& w : TheNotifier().watchers) {
    if (w.key == in_key && w.cb == cb && w.data == user_data) return VCONF_OK;
  }
  if (EnsureWatch(in_key) != 0) return VCONF_ERROR;
  TheNotifier().watchers.push_back(Watcher{in_key, cb, user_data});
  return VCONF_OK;
}

int vconf_ignore_key_changed(const char* in_key, vconf_callback_fn cb) {
  if (in_key == nullptr || cb == nullptr) return VCONF_ERROR;
  auto& ws = TheNotifier().watchers;
  size_t before = ws.size();
  ws.erase(std::remove_if(ws.begin(), ws.end(),
                          [&](const Watcher& w) { return w.key == in_key && w.cb == cb; }),
           ws.end());
  return ws.size() < before ? VCONF_OK : VCONF_ERROR;
}

char* vconf_keynode_get_name(keynode_t* keynode) { return keynode ? keynode->keyname : nullptr; }

int vconf_keynode_get_type(keynode_t* keynode) { return keynode ? keynode->type : VCONF_ERROR; }

int vconf_keynode_get_int(keynode_t* keynode) {
  return keynode && keynode->type == VCONF_TYPE_INT ? keynode->value.i : VCONF_ERROR;
}

double vconf_keynode_get_dbl(keynode_t* keynode) {
  return keynode && keynode->type == VCONF_TYPE_DOUBLE ? keynode->value.d : VCONF_ERROR;
}

int vconf_keynode_get_bool(keynode_t* keynode) {
  return keynode && keynode->type == VCONF_TYPE_BOOL ? keynode->value.b : VCONF_ERROR;
}

char* vconf_keynode_get_str(keynode_t* keynode) {
  return keynode && keynode->type == VCONF_TYPE_STRING ? keynode->value.s : nullptr;
}

}  // extern "C"

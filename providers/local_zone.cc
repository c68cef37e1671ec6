#include "providers/local_zone.h"

#include <errno.h>
#include <string.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <mutex>

#include "platform/fixed_path.h"

namespace _CorvaneLogManager {
namespace {

const char kLink[] = "/opt/etc/localtime";
const char kLinkDirectory[] = "/opt/etc";
constexpr size_t kZoneinfoPrefix = sizeof("/usr/share/zoneinfo/") - 1;

// A path walk per insert cost more than the insert's own statement work; a non-blocking read of
// an inotify descriptor that has nothing to say costs a fraction of it.
struct ZoneCache {
  std::mutex lock;
  int watch = -1;         // inotify descriptor watching the link's directory
  std::string directory;  // which directory, as mapped (the sysroot may differ per process use)
  bool known = false;     // |valid| and |zone| hold the link as read since the last change
  bool valid = false;
  std::string zone;  // as a literal
};

ZoneCache g_cache;

bool ReadZone(const char* link, std::string* zone) {
  char target[1024];
  ssize_t len = readlink(link, target, sizeof(target) - 1);
  if (len <= static_cast<ssize_t>(kZoneinfoPrefix)) return false;  // unreadable or no zone
  zone->assign(1, '\'');
  for (ssize_t i = kZoneinfoPrefix; i < len; ++i) {
    if (target[i] == '\'') zone->push_back('\'');
    zone->push_back(target[i]);
  }
  zone->push_back('\'');
  return true;
}

void DropWatch(ZoneCache* cache) {
  if (cache->watch >= 0) close(cache->watch);
  cache->watch = -1;
  cache->known = false;
}

// True while the cached answer still stands: the watch is on |directory| and has seen nothing.
bool StillKnown(ZoneCache* cache, const char* directory) {
  if (cache->watch < 0 || cache->directory != directory) return false;
  char events[4096] __attribute__((aligned(alignof(struct inotify_event))));
  ssize_t got = read(cache->watch, events, sizeof(events));
  if (got < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) return cache->known;
  // Any event (or a failed read) may mean a new link; the directory itself gone or moved ends
  // the watch, so the next call sets it on whatever stands there then.
  bool ended = got <= 0;
  for (ssize_t at = 0; !ended && at < got;) {
    const struct inotify_event* event = reinterpret_cast<const struct inotify_event*>(events + at);
    if ((event->mask & (IN_IGNORED | IN_DELETE_SELF | IN_MOVE_SELF | IN_Q_OVERFLOW)) != 0)
      ended = true;
    at += static_cast<ssize_t>(sizeof(struct inotify_event) + event->len);
  }
  if (ended) DropWatch(cache);
  cache->known = false;
  return false;
}

}  // namespace

bool LocalZoneLiteral(std::string* literal) {
  char linkBuf[4096];
  char directoryBuf[4096];
  const char* link = logmgr_fixed_path(kLink, linkBuf, sizeof(linkBuf));
  const char* directory = logmgr_fixed_path(kLinkDirectory, directoryBuf, sizeof(directoryBuf));
  std::lock_guard<std::mutex> hold(g_cache.lock);
  if (!StillKnown(&g_cache, directory)) {
    if (g_cache.watch >= 0 && g_cache.directory != directory) DropWatch(&g_cache);
    if (g_cache.watch < 0) {
      // The watch goes on before the read, so a change after the read is never missed.
      g_cache.watch = inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
      if (g_cache.watch >= 0 &&
          inotify_add_watch(g_cache.watch, directory,
                            IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO | IN_ATTRIB |
                                IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR) < 0)
        DropWatch(&g_cache);
      g_cache.directory = directory;
    }
    g_cache.valid = ReadZone(link, &g_cache.zone);
    g_cache.known = g_cache.watch >= 0;
  }
  if (!g_cache.valid) return false;
  *literal = g_cache.zone;
  return true;
}

}  // namespace _CorvaneLogManager

// Debian's EFL has no GLib integration, so Ecore's select runs one GLib iteration around it:
// acquire, prepare, query the poll fds and timeout into the fd sets, select with the smaller
// timeout, check, dispatch, release.
#include <Ecore.h>
#include <errno.h>
#include <glib.h>
#include <sys/select.h>

#include <vector>

#include "platform/main_loop_glib.h"

namespace {

int GlibSelect(int nfds, fd_set* rfds, fd_set* wfds, fd_set* efds, struct timeval* tv) {
  GMainContext* ctx = g_main_context_default();
  if (!g_main_context_acquire(ctx)) return select(nfds, rfds, wfds, efds, tv);

  static std::vector<GPollFD> fds(16);
  gint max_priority = 0;
  (void)g_main_context_prepare(ctx, &max_priority);
  gint glib_timeout = -1;
  gint n = 0;
  while ((n = g_main_context_query(ctx, max_priority, &glib_timeout, fds.data(),
                                   static_cast<gint>(fds.size()))) >
         static_cast<gint>(fds.size())) {
    fds.resize(static_cast<size_t>(n));
  }

  for (gint i = 0; i < n; ++i) {
    int fd = fds[i].fd;
    if (fd < 0 || fd >= FD_SETSIZE) continue;
    if (fds[i].events & (G_IO_IN | G_IO_HUP | G_IO_ERR)) FD_SET(fd, rfds);
    if (fds[i].events & G_IO_OUT) FD_SET(fd, wfds);
    if (fds[i].events & G_IO_PRI) FD_SET(fd, efds);
    if (fd + 1 > nfds) nfds = fd + 1;
  }

  struct timeval glib_tv;
  struct timeval* use_tv = tv;
  if (glib_timeout >= 0) {
    glib_tv.tv_sec = glib_timeout / 1000;
    glib_tv.tv_usec = (glib_timeout % 1000) * 1000;
    if (tv == nullptr || timercmp(&glib_tv, tv, <)) use_tv = &glib_tv;
  }

  int ret = select(nfds, rfds, wfds, efds, use_tv);
  int saved_errno = errno;

  for (gint i = 0; i < n; ++i) {
    int fd = fds[i].fd;
    fds[i].revents = 0;
    if (ret <= 0 || fd < 0 || fd >= FD_SETSIZE) continue;
    if (FD_ISSET(fd, rfds)) fds[i].revents |= fds[i].events & (G_IO_IN | G_IO_HUP | G_IO_ERR);
    if (FD_ISSET(fd, wfds)) fds[i].revents |= G_IO_OUT;
    if (FD_ISSET(fd, efds)) fds[i].revents |= G_IO_PRI;
  }

  if (g_main_context_check(ctx, max_priority, fds.data(), n)) g_main_context_dispatch(ctx);
  g_main_context_release(ctx);
  errno = saved_errno;
  return ret;
}

}  // namespace

extern "C" int logmgr_main_loop_glib_integrate(void) {
  ecore_main_loop_select_func_set(GlibSelect);
  return 1;
}

"""Helpers shared by devsim's event sources: the sysroot, the system bus, signals."""
import os

import dbus
import dbus.lowlevel


class DevsimError(Exception):
    """A failure to report as one line on stderr with exit status 1."""


def register(sub):
    """Not an event source."""


def fixed_path(path):
    """A fixed device path beneath $LOGMGR_SYSROOT, as the daemon resolves it."""
    root = os.environ.get("LOGMGR_SYSROOT")
    if not root or path.startswith("/proc"):
        return path
    return root.rstrip("/") + path


def system_bus():
    try:
        return dbus.SystemBus()
    except dbus.exceptions.DBusException as e:
        raise DevsimError(f"cannot reach the system bus: {e.get_dbus_message()}")


def send_signal(path, interface, member, *args, signature=None, destination=None):
    """Emits one signal on the system bus and flushes it before returning."""
    bus = system_bus()
    msg = dbus.lowlevel.SignalMessage(path, interface, member)
    if destination:
        msg.set_destination(destination)
    if args:
        msg.append(*args, signature=signature)
    bus.send_message(msg)
    bus.flush()
    # The daemon asks the bus who sent a platform signal; a sender gone by then is nobody.
    # Its answer to a ping comes after it has handled the signal, so stay connected till then.
    try:
        bus.call_blocking("com.corvane.logmgr", "/", "org.freedesktop.DBus.Peer", "Ping", "", (),
                          timeout=30)
    except dbus.exceptions.DBusException:
        pass  # no daemon running: nobody to wait for

"""Client side of the daemon's shared tables for the bus tests: python3-dbus proxies and
System V segments through libc."""
import ctypes
import os

import dbus

PATH_PREFIX = "/com/corvane/logmgr/log/provider/"
IFACE_PREFIX = "com.corvane.logmgr.log.provider."
FEATURE = "use_app_feature_survey"
STATUS = "report_app_status_survey"

_libc = ctypes.CDLL(None, use_errno=True)
_libc.shmat.restype = ctypes.c_void_p
_libc.shmat.argtypes = [ctypes.c_int, ctypes.c_void_p, ctypes.c_int]
_libc.shmdt.argtypes = [ctypes.c_void_p]
_libc.shmget.argtypes = [ctypes.c_int, ctypes.c_size_t, ctypes.c_int]
_libc.shmctl.argtypes = [ctypes.c_int, ctypes.c_int, ctypes.c_void_p]
IPC_PRIVATE, IPC_CREAT, IPC_RMID = 0, 0o1000, 0


def table_proxy(dev, table):
    """A proxy of one shared table on the device's private system bus."""
    bus = dbus.bus.BusConnection(dev.env["DBUS_SYSTEM_BUS_ADDRESS"])
    obj = bus.get_object("com.corvane.logmgr", PATH_PREFIX + table)
    return dbus.Interface(obj, IFACE_PREFIX + table)


class Segment:
    """A segment of |size| bytes owned by the caller, removed on close."""

    def __init__(self, size, shm_id=None):
        self.size = size
        self.id = shm_id if shm_id is not None else _libc.shmget(IPC_PRIVATE, size,
                                                                 IPC_CREAT | 0o600)
        if self.id < 0:
            raise OSError(ctypes.get_errno(), "shmget")

    def read(self):
        base = _libc.shmat(self.id, None, 0)
        if base in (None, ctypes.c_void_p(-1).value):
            raise OSError(ctypes.get_errno(), "shmat")
        try:
            return ctypes.string_at(base, self.size)
        finally:
            _libc.shmdt(base)

    def close(self):
        _libc.shmctl(self.id, IPC_RMID, None)


def parse_segment(data):
    """Rows written by Select: texts each ended by a NUL, then '&'. None without an end mark."""
    rows, pos = [], 0
    while pos < len(data):
        if data[pos:pos + 1] == b"&" and data[pos + 1:pos + 2] in (b"", b"\0"):
            return rows
        end = data.find(b"\0", pos)
        if end < 0:
            return None
        rows.append(data[pos:end].decode())
        pos = end + 1
    return None


def prepare_for_other_users(dev):
    """Lets a process of another user reach the private bus socket in the sysroot."""
    path = dev.path("/run/dbus")
    while True:
        os.chmod(path, os.stat(path).st_mode | 0o011)
        if os.path.realpath(path) == os.path.realpath(dev.sysroot) or path == "/":
            break
        path = os.path.dirname(path)


def raw_call(dev, table, method, signature, *args):
    """A method call with an explicit signature, bypassing the proxy's introspected one."""
    bus = dbus.bus.BusConnection(dev.env["DBUS_SYSTEM_BUS_ADDRESS"])
    return bus.call_blocking("com.corvane.logmgr", PATH_PREFIX + table, IFACE_PREFIX + table,
                             method, signature, args)

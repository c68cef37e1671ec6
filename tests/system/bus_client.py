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


# Runs as another user: one method call on a shared table, optionally into a segment of its
# own making, and prints what came back as JSON.
_CALLER = r'''
import ctypes, json, sys
import dbus
a = json.loads(sys.argv[1])
libc = ctypes.CDLL(None, use_errno=True)
libc.shmat.restype = ctypes.c_void_p
libc.shmat.argtypes = [ctypes.c_int, ctypes.c_void_p, ctypes.c_int]
libc.shmget.argtypes = [ctypes.c_int, ctypes.c_size_t, ctypes.c_int]
libc.shmctl.argtypes = [ctypes.c_int, ctypes.c_int, ctypes.c_void_p]
out, seg, base = {}, a.get("shm_id"), None
if a.get("segment"):
    seg = libc.shmget(0, a["segment"], 0o1000 | a.get("mode", 0o600))
    out["shm_id"] = seg
    if a.get("removed"):  # attached here, then marked for removal before the call
        base = libc.shmat(seg, None, 0)
        libc.shmctl(seg, 0, None)
bus = dbus.bus.BusConnection(a["address"])
proxy = dbus.Interface(bus.get_object("com.corvane.logmgr", a["path"]), a["iface"])
params = list(a["params"])
if a["method"] in ("Insert", "Update"):
    params[0] = dbus.Dictionary(params[0], signature="ss")
if a["method"] == "Select":
    params.append(dbus.UInt32(seg))
try:
    result = getattr(proxy, a["method"])(*params, timeout=600)
    out["result"] = None if result is None else int(result)
except dbus.DBusException as e:
    out["error"] = e.get_dbus_message() or e.get_dbus_name()
if seg is not None and seg >= 0 and a.get("segment"):
    if base is None:
        base = libc.shmat(seg, None, 0o10000)
    out["segment"] = ctypes.string_at(base, min(a["segment"], 4096)).hex()
    libc.shmctl(seg, 0, None)
print(json.dumps(out))
'''


def call_as(dev, prefix, table, method, *params, **segment):
    """|method| of |table| called by a process started with |prefix| (setpriv ...). Returns a
    dict: result or error, and shm_id and the segment's first bytes (hex) when a segment of
    size segment=N (mode=, removed=True) was made for a Select."""
    import json
    import subprocess
    request = dict(address=dev.env["DBUS_SYSTEM_BUS_ADDRESS"], path=PATH_PREFIX + table,
                   iface=IFACE_PREFIX + table, method=method, params=list(params), **segment)
    r = subprocess.run(list(prefix) + ["/usr/bin/python3", "-c", _CALLER, json.dumps(request)],
                       capture_output=True, text=True, timeout=900)
    if r.returncode != 0:
        raise AssertionError(f"caller failed: {r.stderr}")
    return json.loads(r.stdout)

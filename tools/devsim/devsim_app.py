"""devsim app: installed applications as real processes with real X windows.

install  adds the app to the app database, with a copy of a small program as its executable
launch   starts that executable and announces the pid (aul "app_launch")
focus    maps a window owned by the app (_NET_WM_PID, _NET_WM_NAME) and makes it the active
         window and the input focus
kill     ends the process, waits until it is gone and announces the death (aul "app_dead")

A window lives in a small keeper process (this file run as a script) that ends with the app.
"""
import json
import os
import shutil
import signal
import sqlite3
import subprocess
import sys
import time

if __name__ != "__main__":
    from devsim_common import DevsimError, fixed_path, send_signal

APP_DB = "/opt/dbspace/.pkgmgr_parser.db"
STATE_DIR = "/run/devsim/apps"
# The app's program: it runs until killed and is a real ELF, so /proc/<pid>/exe names the copy.
PROGRAM = shutil.which("sleep") or "/usr/bin/sleep"
AUL_PATH = "/aul/dbus_handler"
AUL_IFACE = "org.tizen.aul.signal"


# --- the app database ----------------------------------------------------------------------
def open_app_db():
    path = fixed_path(APP_DB)
    os.makedirs(os.path.dirname(path), exist_ok=True)
    try:
        con = sqlite3.connect(path, timeout=5)
        con.execute("CREATE TABLE IF NOT EXISTS package_app_info(app_id TEXT PRIMARY KEY, "
                    "package TEXT NOT NULL, app_exec TEXT NOT NULL)")
        # aul finds the app of every activated window by its executable.
        con.execute("CREATE INDEX IF NOT EXISTS package_app_info_exec "
                    "ON package_app_info(app_exec)")
    except sqlite3.DatabaseError as e:
        raise DevsimError(f"app database {path}: {e}")
    return con


def default_exec(appid, package):
    return f"/opt/usr/apps/{package}/bin/{appid}"


def add_app(appid, package, exec_path=None):
    """Installs (or reinstalls) one app; its executable is created when missing."""
    exec_path = exec_path or default_exec(appid, package)
    target = fixed_path(exec_path)
    if not os.path.exists(target):
        os.makedirs(os.path.dirname(target), exist_ok=True)
        shutil.copy2(PROGRAM, target)
    con = open_app_db()
    with con:
        con.execute("INSERT OR REPLACE INTO package_app_info(app_id, package, app_exec) "
                    "VALUES (?, ?, ?)", (appid, package, exec_path))
    con.close()
    return exec_path


def remove_package(package):
    con = open_app_db()
    with con:
        con.execute("DELETE FROM package_app_info WHERE package = ?", (package,))
    con.close()


def app_exec(appid):
    con = open_app_db()
    row = con.execute("SELECT app_exec FROM package_app_info WHERE app_id = ?",
                      (appid,)).fetchone()
    con.close()
    if row is None:
        raise DevsimError(f"no installed app {appid}")
    return row[0]


# --- processes -----------------------------------------------------------------------------
def alive(pid):
    """True while |pid| runs (a zombie counts as gone)."""
    try:
        with open(f"/proc/{pid}/stat") as f:
            return f.read().rsplit(")", 1)[1].split()[0] != "Z"
    except (OSError, IndexError):
        return False


def state_path(appid):
    return os.path.join(fixed_path(STATE_DIR), appid + ".json")


def load_state(appid):
    try:
        with open(state_path(appid)) as f:
            return json.load(f)
    except (OSError, ValueError):
        return {}


def save_state(appid, state):
    os.makedirs(fixed_path(STATE_DIR), exist_ok=True)
    with open(state_path(appid), "w") as f:
        json.dump(state, f)


def running_pid(appid):
    pid = load_state(appid).get("pid")
    if not pid or not alive(pid):
        raise DevsimError(f"{appid} is not running (devsim app launch {appid})")
    return pid


def announce(member, pid):
    send_signal(AUL_PATH, AUL_IFACE, member, pid, signature="u")


# --- X -------------------------------------------------------------------------------------
def activate(window_id):
    """Makes |window_id| the active window (as type WINDOW) and the input focus."""
    from Xlib import X, Xatom, display
    try:
        d = display.Display()
    except Exception as e:  # Xlib raises several unrelated types for a missing display
        raise DevsimError(f"cannot open the X display: {e}")
    root = d.screen().root
    root.change_property(d.intern_atom("_NET_ACTIVE_WINDOW"), Xatom.WINDOW, 32, [window_id])
    d.set_input_focus(window_id, X.RevertToParent, X.CurrentTime)
    d.sync()
    d.close()


def start_keeper(appid, pid, with_pid):
    """Starts the process that owns the app's window; returns the window id once mapped."""
    args = [sys.executable, os.path.realpath(__file__), "--keeper", str(pid), appid,
            "1" if with_pid else "0"]
    # No inherited output: whoever reads this command's output must not wait for the keeper.
    keeper = subprocess.Popen(args, stdout=subprocess.PIPE, stdin=subprocess.DEVNULL,
                              stderr=subprocess.DEVNULL,
                              start_new_session=True, text=True)
    line = keeper.stdout.readline().strip()
    keeper.stdout.close()
    if not line.isdigit():
        keeper.kill()
        raise DevsimError(f"could not map a window for {appid}")
    return keeper.pid, int(line)


def keeper_main(pid, name, with_pid):
    from Xlib import X, Xatom, display
    d = display.Display()
    screen = d.screen()
    win = screen.root.create_window(0, 0, 200, 200, 0, screen.root_depth,
                                    event_mask=X.StructureNotifyMask)
    if with_pid:
        win.change_property(d.intern_atom("_NET_WM_PID"), Xatom.CARDINAL, 32, [pid])
    win.change_property(d.intern_atom("_NET_WM_NAME"), d.intern_atom("UTF8_STRING"), 8,
                        name.encode())
    win.set_wm_name(name)
    win.map()
    while d.next_event().type != X.MapNotify:
        pass
    print(win.id, flush=True)
    signal.signal(signal.SIGTERM, lambda *_: sys.exit(0))
    while alive(pid):
        while d.pending_events():
            d.next_event()
        time.sleep(0.1)


# --- subcommands ---------------------------------------------------------------------------
def register(sub):
    p = sub.add_parser("app", help="installed applications: install|launch|focus|kill APPID")
    s = p.add_subparsers(dest="action", metavar="ACTION", required=True)
    i = s.add_parser("install", help="add the app to the app database")
    i.add_argument("appid")
    i.add_argument("--package", help="package id (default: the app id)")
    i.add_argument("--exec", dest="exec_path", help="device path of the executable")
    i.set_defaults(func=install)
    launch_p = s.add_parser("launch", help="start the app's process and announce it")
    launch_p.add_argument("appid")
    launch_p.set_defaults(func=launch)
    f = s.add_parser("focus", help="make a window of the app active and focused")
    f.add_argument("appid")
    f.add_argument("--no-pid", action="store_true", help="leave _NET_WM_PID off the window")
    f.set_defaults(func=focus)
    k = s.add_parser("kill", help="end the app's process and announce its death")
    k.add_argument("appid")
    k.set_defaults(func=kill)


def install(args):
    print(add_app(args.appid, args.package or args.appid, args.exec_path))


def launch(args):
    exe = fixed_path(app_exec(args.appid))
    try:
        proc = subprocess.Popen([exe, "infinity"], stdin=subprocess.DEVNULL,
                                stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL,
                                start_new_session=True)
    except OSError as e:
        raise DevsimError(f"cannot start {exe}: {e}")
    proc.returncode = 0  # left running on purpose; the app outlives this command
    save_state(args.appid, {"pid": proc.pid})
    announce("app_launch", proc.pid)
    print(proc.pid)


def focus(args):
    pid = running_pid(args.appid)
    state = load_state(args.appid)
    keeper = state.get("keeper")
    if not keeper or not alive(keeper) or state.get("with_pid") != (not args.no_pid):
        if keeper and alive(keeper):
            os.kill(keeper, signal.SIGTERM)
        keeper, window = start_keeper(args.appid, pid, not args.no_pid)
        state.update(keeper=keeper, window=window, with_pid=not args.no_pid)
        save_state(args.appid, state)
    activate(state["window"])
    print(state["window"])


def kill(args):
    state = load_state(args.appid)
    pid = running_pid(args.appid)
    os.kill(pid, signal.SIGKILL)
    keeper = state.get("keeper")
    if keeper and alive(keeper):
        os.kill(keeper, signal.SIGTERM)
    deadline = time.monotonic() + 10
    while alive(pid) or (keeper and alive(keeper)):
        if time.monotonic() > deadline:
            raise DevsimError(f"{args.appid} (pid {pid}) did not end")
        time.sleep(0.02)
    os.unlink(state_path(args.appid))
    announce("app_dead", pid)
    print(pid)


if __name__ == "__main__" and len(sys.argv) == 5 and sys.argv[1] == "--keeper":
    keeper_main(int(sys.argv[2]), sys.argv[3], sys.argv[4] == "1")

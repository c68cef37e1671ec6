"""devsim pkg and crash: package manager requests and application crashes.

pkg install|update|uninstall PKGID [--fail]  changes the app database (unless the request
    fails) and broadcasts the request's status sequence: start, progress, end ok|fail
crash APPID  broadcasts "ProcessCrashed" with the app's executable path
"""
import os
import time

from devsim_app import add_app, app_exec, open_app_db, remove_package
from devsim_common import send_signal

STATUS_PATH = "/org/tizen/pkgmgr_status"
STATUS_IFACE = "org.tizen.pkgmgr_status"
CRASH_PATH = "/Org/Tizen/System/Crash/Crash"
CRASH_IFACE = "org.tizen.system.crash.Crash"
PROGRESS = ("0", "30", "60", "100")


def register(sub):
    p = sub.add_parser("pkg", help="package requests: install|update|uninstall PKGID [--fail]")
    p.add_argument("action", choices=("install", "update", "uninstall"))
    p.add_argument("pkgid")
    p.add_argument("--fail", action="store_true", help="the request ends with \"fail\"")
    p.add_argument("--type", default="tpk", help="package type text (default tpk)")
    p.set_defaults(func=pkg)
    c = sub.add_parser("crash", help="announce a crash of an installed app's executable")
    c.add_argument("appid")
    c.set_defaults(func=crash)


def status(req_id, pkg_type, pkgid, key, val):
    send_signal(STATUS_PATH, STATUS_IFACE, "status", req_id, pkg_type, pkgid, key, val,
                signature="sssss")


def pkg(args):
    req_id = f"{os.getpid()}_{time.monotonic_ns()}"
    status(req_id, args.type, args.pkgid, "start", args.action)
    for percent in PROGRESS:
        status(req_id, args.type, args.pkgid, "install_percent", percent)
    if not args.fail:
        if args.action == "uninstall":
            remove_package(args.pkgid)
        elif args.action == "install" or not package_installed(args.pkgid):
            add_app(args.pkgid, args.pkgid)
    status(req_id, args.type, args.pkgid, "end", "fail" if args.fail else "ok")


def package_installed(pkgid):
    con = open_app_db()
    row = con.execute("SELECT 1 FROM package_app_info WHERE package = ?", (pkgid,)).fetchone()
    con.close()
    return row is not None


def crash(args):
    exe = app_exec(args.appid)
    send_signal(CRASH_PATH, CRASH_IFACE, "ProcessCrashed", os.path.basename(exe), exe,
                signature="ss")

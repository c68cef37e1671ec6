"""devsim device events: screen, lock, charger, earjack, Wi-Fi, Bluetooth, capture, movement.

Settings go through vconftool, the battery through the power-supply files of the sysroot,
Bluetooth through the BlueZ mock on the system bus (host-env --mock bluez5).
"""
import os
import shutil
import subprocess

import dbus

from devsim_common import DevsimError, fixed_path, send_signal, system_bus

HERE = os.path.dirname(os.path.abspath(__file__))
SUPPLIES = "/sys/class/power_supply"
ADAPTER = "hci0"
MOCK_IFACE = "org.bluez.Mock"


def register(sub):
    p = sub.add_parser("screen", help="display on, off or dimmed (memory/pm/state)")
    p.add_argument("state", choices=["on", "off", "dim"])
    p.set_defaults(func=screen)

    for name, value in (("lock", 1), ("unlock", 0)):
        p = sub.add_parser(name, help=f"{name} the device (memory/idle_lock/state)")
        p.set_defaults(func=lambda a, v=value: vconf_int("memory/idle_lock/state", v))

    p = sub.add_parser("charger", help="plug or unplug the charger, with the battery level")
    csub = p.add_subparsers(dest="action", metavar="ACTION", required=True)
    plug = csub.add_parser("plug", help="charger connected: plug usb|ac PERCENT")
    plug.add_argument("kind", choices=["usb", "ac"])
    plug.add_argument("percent", type=percent)
    plug.set_defaults(func=charger_plug)
    unplug = csub.add_parser("unplug", help="charger disconnected: unplug PERCENT")
    unplug.add_argument("percent", type=percent)
    unplug.set_defaults(func=charger_unplug)

    p = sub.add_parser("earjack", help="headset in or out (memory/sysman/earjack)")
    p.add_argument("state", choices=["in", "out"])
    p.set_defaults(func=lambda a: vconf_int("memory/sysman/earjack", 3 if a.state == "in" else 0))

    p = sub.add_parser("wifi", help="Wi-Fi connected or off (memory/dnet/wifi)")
    p.add_argument("state", choices=["on", "off"])
    p.set_defaults(func=lambda a: vconf_int("memory/dnet/wifi", 2 if a.state == "on" else 0))

    p = sub.add_parser("bt", help="pair or unpair a Bluetooth device (needs the BlueZ mock)")
    bsub = p.add_subparsers(dest="action", metavar="ACTION", required=True)
    pair = bsub.add_parser("pair", help="pair ADDRESS CLASS (class of device, e.g. 0x240404)")
    pair.add_argument("address")
    pair.add_argument("device_class", type=lambda s: int(s, 0))
    pair.set_defaults(func=bt_pair)
    unpair = bsub.add_parser("unpair", help="unpair ADDRESS (the bond is removed)")
    unpair.add_argument("address")
    unpair.set_defaults(func=bt_unpair)

    p = sub.add_parser("capture", help="a screen capture (notification status message)")
    p.add_argument("text", nargs="?", default="Screen captured.")
    p.set_defaults(func=capture)

    p = sub.add_parser("move", help="a movement wake-up (sensor context)")
    p.set_defaults(func=move)


def percent(text):
    value = int(text)
    if not 0 <= value <= 100:
        raise ValueError(text)
    return value


def vconf_int(key, value):
    tool = os.path.join(os.path.dirname(HERE), "vconftool")
    if not os.path.exists(tool):
        tool = shutil.which("vconftool")
    if not tool:
        raise DevsimError("vconftool not found")
    r = subprocess.run([tool, "set", "-t", "int", key, str(value)], capture_output=True,
                       text=True)
    if r.returncode != 0:
        raise DevsimError(r.stderr.strip() or f"cannot set {key}")


def screen(args):
    vconf_int("memory/pm/state", {"on": 1, "dim": 2, "off": 3}[args.state])


def write_supply(name, attributes):
    directory = fixed_path(os.path.join(SUPPLIES, name))
    os.makedirs(directory, exist_ok=True)
    for attr, value in attributes.items():
        tmp = os.path.join(directory, f".{attr}.tmp")
        with open(tmp, "w") as f:
            f.write(f"{value}\n")
        os.replace(tmp, os.path.join(directory, attr))


def charger_plug(args):
    # The files and the kind come first: the daemon reads them when the status changes.
    write_supply("battery", {"type": "Battery", "capacity": args.percent, "status": "Charging"})
    write_supply("ac", {"type": "Mains", "online": 1 if args.kind == "ac" else 0})
    vconf_int("memory/sysman/usb_status", 2 if args.kind == "usb" else 0)
    vconf_int("memory/sysman/charger_status", 1)


def charger_unplug(args):
    write_supply("battery", {"type": "Battery", "capacity": args.percent,
                             "status": "Discharging"})
    write_supply("ac", {"type": "Mains", "online": 0})
    vconf_int("memory/sysman/usb_status", 0)
    vconf_int("memory/sysman/charger_status", 0)


def bluez_mock():
    bus = system_bus()
    try:
        return bus, dbus.Interface(bus.get_object("org.bluez", "/"), MOCK_IFACE)
    except dbus.exceptions.DBusException as e:
        raise DevsimError(f"no BlueZ mock on the bus (host-env --mock bluez5): "
                          f"{e.get_dbus_message()}")


def device_path(address):
    return f"/org/bluez/{ADAPTER}/dev_{address.replace(':', '_').upper()}"


def object_exists(bus, path):
    try:
        intro = bus.get_object("org.bluez", path).Introspect(
            dbus_interface="org.freedesktop.DBus.Introspectable")
    except dbus.exceptions.DBusException:
        return False
    return "org.bluez." in intro


def bt_pair(args):
    bus, mock = bluez_mock()
    try:
        if not object_exists(bus, f"/org/bluez/{ADAPTER}"):
            mock.AddAdapter(ADAPTER, "devsim")
        if not object_exists(bus, device_path(args.address)):
            mock.AddDevice(ADAPTER, args.address, "devsim device")
        mock.PairDevice(ADAPTER, args.address, dbus.Int32(args.device_class))
    except dbus.exceptions.DBusException as e:
        raise DevsimError(f"pairing failed: {e.get_dbus_message()}")


def bt_unpair(args):
    bus, _ = bluez_mock()
    try:
        adapter = dbus.Interface(bus.get_object("org.bluez", f"/org/bluez/{ADAPTER}"),
                                 "org.bluez.Adapter1")
        adapter.RemoveDevice(dbus.ObjectPath(device_path(args.address)))
    except dbus.exceptions.DBusException as e:
        raise DevsimError(f"unpairing failed: {e.get_dbus_message()}")


def capture(args):
    send_signal("/Org/Tizen/System/Notification/Status_message",
                "org.tizen.system.notification.status_message", "status_message", args.text,
                signature="s")


def move(_args):
    # Addressed to the daemon: it adds no match rule for this interface.
    send_signal("/org/tizen/sensor/context/movement", "org.tizen.sensor.context.movement",
                "wakeup", destination="com.corvane.logmgr")

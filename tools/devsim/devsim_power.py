"""devsim poweroff: the device announces power-off."""
from devsim_common import send_signal


def register(sub):
    p = sub.add_parser("poweroff", help="announce power-off (deviced ChangeState)")
    p.add_argument("state", nargs="?", type=int, default=2,
                   help="announced state: 2 power-off (default), 3 restart")
    p.set_defaults(func=poweroff)


def poweroff(args):
    send_signal("/Org/Tizen/System/DeviceD/PowerOff", "org.tizen.system.deviced.PowerOff",
                "ChangeState", args.state, signature="i")

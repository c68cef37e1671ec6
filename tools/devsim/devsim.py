#!/usr/bin/python3
"""devsim: the simulated device. One subcommand per event source.

Each event source lives in a module devsim_<source>.py beside this file and registers its
subcommands with register(subparsers).
"""
import argparse
import glob
import importlib
import os
import sys

HERE = os.path.dirname(os.path.realpath(__file__))
sys.path.insert(0, HERE)

from devsim_common import DevsimError  # noqa: E402


def main(argv):
    parser = argparse.ArgumentParser(prog="devsim", description="Drive the simulated device.")
    sub = parser.add_subparsers(dest="command", metavar="COMMAND")
    for path in sorted(glob.glob(os.path.join(HERE, "devsim_*.py"))):
        module = importlib.import_module(os.path.basename(path)[:-3])
        module.register(sub)
    args = parser.parse_args(argv)
    if not getattr(args, "func", None):
        parser.print_help(sys.stderr)
        return 2
    try:
        return args.func(args) or 0
    except DevsimError as e:
        sys.stderr.write(f"devsim: {e}\n")
        return 1


if __name__ == "__main__":
    sys.exit(main(sys.argv[1:]))

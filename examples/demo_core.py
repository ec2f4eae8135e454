#!/usr/bin/env python3
"""The demo product's server program in Python, doing what demo_core.cpp does:
answer -h with its version (or torvad hands the service over to it), read the
supervisor's version, have tools run through execute under the rules of
exec.patterns, fail once so torvad starts it again, say it is ready, and end on
sigterm. Copied to examples/demo/core it stands in for the C++ one."""
import getpass
import os
import sys

import torvad_peer as tp

# Channel ids are ours to choose; the upper 12 bits name a module in the trace.
SYSMGMT = 55 << 20
TOOLS = {
    SYSMGMT | 1: ("uname -sr", 0, ["uname", "-sr"]),
    SYSMGMT | 2: ("cat /etc/shadow", 0, ["cat", "/etc/shadow"]),
    SYSMGMT | 3: ("whoami as nobody", tp.EXECUTE_USER, ["nobody", "whoami"]),
}


def say(text):
    print("core: " + text, flush=True)


# One failure per `make run`, which removes the marker before it starts us.
def fail_this_time():
    try:
        os.close(os.open("failed-once.marker", os.O_CREAT | os.O_EXCL | os.O_WRONLY, 0o644))
        return True
    except FileExistsError:
        return False


# Prints what comes back on each channel; True when torvad asked us to end.
def serve(link):
    for packet in iter(link.receive, None):
        name = TOOLS.get(packet.channel, ("?",))[0]
        if packet.type == tp.OPENED:
            say(f"'{name}' running as pid {packet.flags}")
        elif packet.type in (tp.STDOUT, tp.STDERR):
            say(f"'{name}' says: {packet.payload.decode(errors='replace')}".rstrip("\n"))
        elif packet.type == tp.FAILED:
            denied = " (not permitted)" if packet.flags == tp.STATUS_NOT_PERMITTED else ""
            say(f"'{name}' refused with status {packet.flags}{denied}")
        elif packet.type == tp.CLOSED:
            say(f"'{name}' ended with {packet.flags}")
        elif packet.type == tp.SIGTERM:
            say("asked to stop, ending cleanly")
            return True
    return False


def account():
    return f"uid {os.getuid()}" if hasattr(os, "getuid") else getpass.getuser()


def main():
    # A console's Ctrl-Break or close reaches us as it reaches torvad, whose
    # sigterm is then our orderly end.
    tp.outlive_console_events()
    # torvad asks this before every start; without "version" on the first
    # line of stderr it would hand the service over to us.
    if sys.argv[1:2] == ["-h"]:
        print("demo core version 1.0", file=sys.stderr)
        return 0
    link = tp.connect()
    if link is None:
        print("core: run me under torvad: make run", file=sys.stderr)
        return 2
    version = link.read_version()
    if version is None:
        return 3
    say(f"supervised by {version.program_name} {version.version}, running as {account()}")
    if fail_this_time():
        say("failing once on purpose; torvad starts a failed program again")
        return 3
    for channel, (_, flags, items) in TOOLS.items():
        link.execute(channel, flags | tp.EXECUTE_STDIO_PIPES, items)
    link.send_ready()
    # 0 tells torvad this was an orderly end, not one to restart.
    return 0 if serve(link) else 1


if __name__ == "__main__":
    sys.exit(main())

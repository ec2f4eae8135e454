"""The Python peer as a child of torvad: first its promises on a socket pair of
its own, then the protocol through asyncio: a cat fed on its stdin and closed,
readiness, and an end at sigterm. It reports in lines "child: ..."."""
import asyncio
import socket
import struct
import sys
import time

import torvad_peer as tp


def say(text):
    print("child: " + text, flush=True)


def promises():
    ours, theirs = socket.socketpair()
    link = tp.Connection(ours.detach(), send_timeout=0.2)
    started = time.monotonic()
    while link.send(1, tp.STDIN, 0, bytes(tp.MAX_PAYLOAD)):  # until the pair is full
        pass
    waited = time.monotonic() - started
    theirs.sendall(struct.pack("<4I", tp.MAX_SIZE + 1, 0, 0, 0))
    too_large = bytes(tp.MAX_PAYLOAD + 1)
    kept = [0.2 <= waited < 5, link.receive() is None, not link.send(0, tp.STDIN, 0, too_large)]
    theirs.close()
    return all(kept + [not link.send_ready()])


async def serve():
    link = await tp.AsyncConnection.connect()
    version = await link.read_version()
    say(f"version {version.program_name} {version.version}")
    await link.execute(1, tp.EXECUTE_STDIO_PIPES, ["cat"])
    await link.send_stdin(1, b"relayed through cat", close=True)
    await link.send_ready()
    while (packet := await link.receive()) is not None:
        if packet.type == tp.STDOUT:
            say("cat says: " + packet.payload.decode())
        elif packet.type == tp.CLOSED:
            say(f"cat ended with {packet.flags}")
        elif packet.type == tp.SIGTERM:
            return say("sigterm") or 0
    return 4


say("promises kept" if promises() else "promises broken")
sys.exit(asyncio.run(serve()))

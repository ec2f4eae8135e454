"""torvad's ipc protocol for product programs written in Python.

A product program is one of torvad's persistent children. torvad appends the
link of its end of the pipe as the last argument, sends `version` first, and
asks the program to end with `sigterm`, after which it exits 0:

    import sys, torvad_peer as tp

    link = tp.connect()
    if link is None or link.read_version() is None:
        sys.exit(3)
    link.send_ready()
    link.execute(1, tp.EXECUTE_STDIO_PIPES, ["uname", "-sr"])
    for packet in iter(link.receive, None):
        if packet.type == tp.SIGTERM:
            sys.exit(0)

A packet is a 16-byte header of four little-endian uint32 fields (length,
channel, type, flags) and length - 16 bytes of payload. As in the C++ peer
library, nothing here raises on a pipe torvad closed: a send is then False
and receive() None. Each packet goes out whole in one write, under a lock, so
threads may share a connection for sending; one thread receives. Standard
library only.
"""

import os
import struct
import sys
import threading
import time
from typing import NamedTuple

HEADER_SIZE = 16
MAX_SIZE = 0x10000
MAX_PAYLOAD = MAX_SIZE - HEADER_SIZE

# packet types
STDIN, STDOUT, STDERR, OPENED, FAILED, CLOSED, EXECUTE, VERSION, SIGTERM, READY = range(10)
# flags of a stdin packet
STDIN_CLOSE = 1
# flags of an execute packet
EXECUTE_PERSISTENT, EXECUTE_STDIO_PIPES, EXECUTE_STDIO_NONE = 1, 2, 4
EXECUTE_USER, EXECUTE_PATH = 8, 16
# statuses of a failed packet that torvad chooses itself
STATUS_NOT_FOUND, STATUS_NOT_PERMITTED, STATUS_MALFORMED = 2, 13, 22

_header = struct.Struct("<4I")


class Packet(NamedTuple):
    channel: int
    type: int
    flags: int  # opened: the pid; failed, closed: the status
    payload: bytes


class Version(NamedTuple):
    program_name: str
    version: str
    background: bool


def encode(channel, type, flags=0, payload=b""):
    """One whole packet; None when the payload is larger than a packet holds."""
    payload = _bytes(payload)
    if len(payload) > MAX_PAYLOAD:
        return None
    return _header.pack(HEADER_SIZE + len(payload), channel, type, flags) + payload


def parse_version(packet):
    """The three items of a version packet; None when the packet isn't one."""
    items = packet.payload.split(b"\0") if packet.type == VERSION else []
    if len(items) != 3 or not items[2].startswith(b"Background:"):
        return None
    text = [item.decode(errors="replace") for item in items]
    return Version(text[0], text[1], text[2] == "Background:true")


def _bytes(value):
    return os.fsencode(value) if isinstance(value, str) else bytes(value)


def _execute_payload(items):
    return b"\0".join(_bytes(item) for item in items)


class Connection:
    """Owns a link to torvad (a descriptor, or a pipe handle on Windows)."""

    def __init__(self, link, send_timeout=None):
        self._link = _Link(link)
        # Seconds a send may wait in all for torvad to take the packet; None:
        # no limit.
        self.send_timeout = send_timeout
        # Once a send gave up with part of its packet out, torvad can't find
        # where the next one starts: nothing more is sent.
        self._torn = False
        self._buffer = bytearray()  # bytes read but not yet handed out
        self._send_lock = threading.Lock()

    def close(self):
        self._link.close()

    def __enter__(self):
        return self

    def __exit__(self, *exc):
        self.close()

    def receive(self):
        """Blocks for the next whole Packet; None at the end of the stream, on
        an error or on a length outside 16..65536 (the stream can't be
        trusted after that)."""
        while len(self._buffer) < HEADER_SIZE:
            if not self._fill():
                return None
        length, channel, type, flags = _header.unpack_from(self._buffer)
        if not HEADER_SIZE <= length <= MAX_SIZE:
            return None
        while len(self._buffer) < length:
            if not self._fill():
                return None
        payload = bytes(self._buffer[HEADER_SIZE:length])
        del self._buffer[:length]
        return Packet(channel, type, flags, payload)

    def read_version(self):
        """Reads the first packet, which must be a valid version."""
        first = self.receive()
        return parse_version(first) if first is not None else None

    def send(self, channel, type, flags=0, payload=b""):
        """Sends one packet in a single write; False when the payload is too
        large, torvad has gone, or send_timeout passed."""
        block = encode(channel, type, flags, payload)
        if block is None:
            return False
        with self._send_lock:
            sent = 0 if self._torn else self._link.write(block, self.send_timeout)
            self._torn = self._torn or 0 < sent < len(block)
            return sent == len(block)

    def execute(self, channel, flags, items):
        """Asks for items (user with EXECUTE_USER, working directory with
        EXECUTE_PATH, then program and arguments) to run as a new channel."""
        return self.send(channel, EXECUTE, flags, _execute_payload(items))

    def send_stdin(self, channel, data, close=False):
        """Bytes for a channel's standard input; close ends it after them."""
        return self.send(channel, STDIN, STDIN_CLOSE if close else 0, data)

    def send_ready(self):
        """Tells torvad the program serves: sent once, when it does."""
        return self.send(0, READY)

    def _fill(self):
        chunk = self._link.read(MAX_SIZE)
        self._buffer += chunk
        return bool(chunk)


def link_from_arguments(argv=None):
    """The link torvad passed as the last argument, or None when that isn't
    the decimal number of an open descriptor (a pipe handle on Windows)."""
    argv = sys.argv if argv is None else argv
    last = argv[-1] if len(argv) > 1 else ""
    if not (last.isascii() and last.isdigit()) or int(last) > 0x7FFFFFFF:
        return None
    return int(last) if _link_is_open(int(last)) else None


def connect(argv=None, send_timeout=None):
    """A Connection on the link of the last argument, or None."""
    link = link_from_arguments(argv)
    return None if link is None else Connection(link, send_timeout)


if sys.platform == "win32":
    import _winapi

    _ERROR_MORE_DATA = 234
    _CTRL_C, _CTRL_CLOSE, _CTRL_SHUTDOWN = 0, 2, 6
    _console_handler = None  # kept alive for as long as the system may call it

    def outlive_console_events():
        """Keeps the program running through the events a Windows console
        sends to every program on it (Ctrl-Break, its close, the system's
        shutdown, a logoff): torvad hears them too and stops its children in
        order, so the program ends at its sigterm, not before. Call it first
        thing; nothing to do on Linux, where torvad keeps the terminal's
        signals from its children. False when the handler can't be set."""
        global _console_handler
        import ctypes
        from ctypes import wintypes

        # The close and the shutdown end the program once a handler returns,
        # so the handler holds its thread until the program has ended on its
        # own; Ctrl-C goes on to Python's own handler.
        def hold(event):
            while event in (_CTRL_CLOSE, _CTRL_SHUTDOWN):
                time.sleep(3600)
            return event != _CTRL_C

        handler_type = ctypes.WINFUNCTYPE(wintypes.BOOL, wintypes.DWORD)
        _console_handler = handler_type(hold)
        kernel32 = ctypes.WinDLL("kernel32", use_last_error=True)
        return bool(kernel32.SetConsoleCtrlHandler(_console_handler, True))

    def _link_is_open(value):
        try:
            _winapi.PeekNamedPipe(value, 0)
            return True
        except OSError:
            return False

    class _Link:
        # As on Linux, below. torvad opens our end for overlapped input and
        # output, so every read and write names an OVERLAPPED and waits for its
        # own completion.
        def __init__(self, handle):
            self.handle = handle

        def close(self):
            if self.handle is not None:
                _winapi.CloseHandle(self.handle)
                self.handle = None

        def read(self, size):
            try:
                call, error = _winapi.ReadFile(self.handle, size, overlapped=True)
                _, error = call.GetOverlappedResult(True)
            except OSError:
                return b""  # the far end's close shows as a broken pipe
            # A message larger than size comes whole over several reads.
            return call.getbuffer() if error in (0, _ERROR_MORE_DATA) else b""

        def write(self, data, timeout):
            wait = _winapi.INFINITE if timeout is None else int(timeout * 1000)
            try:
                call, error = _winapi.WriteFile(self.handle, data, overlapped=True)
                if error == _winapi.ERROR_IO_PENDING:
                    if _winapi.WaitForMultipleObjects([call.event], False, wait) != 0:
                        call.cancel()
                put, error = call.GetOverlappedResult(True)
            except OSError:
                return 0
            return put

else:
    import fcntl
    import select
    import socket

    def outlive_console_events():
        return True

    def _link_is_open(value):
        try:
            fcntl.fcntl(value, fcntl.F_GETFD)
            return True
        except OSError:
            return False

    class _Link:
        # read() gives b"" at the end or on an error; write() the count of
        # bytes that went out. Sends go without SIGPIPE, and without blocking
        # when a wait is bounded: a socket timeout would bound the reads of
        # other threads too.
        def __init__(self, fd):
            self.socket = socket.socket(fileno=fd)
            self.socket.setblocking(True)

        def close(self):
            self.socket.close()

        def read(self, size):
            try:
                return self.socket.recv(size)  # retried by Python on EINTR
            except OSError:
                return b""

        def write(self, data, timeout):
            flags = socket.MSG_NOSIGNAL | (0 if timeout is None else socket.MSG_DONTWAIT)
            deadline = None if timeout is None else time.monotonic() + timeout
            view, sent, writable = memoryview(data), 0, select.poll()
            writable.register(self.socket, select.POLLOUT)
            while sent < len(data):
                try:
                    sent += self.socket.send(view[sent:], flags)
                except BlockingIOError:
                    left = max(0, deadline - time.monotonic())
                    if not writable.poll(left * 1000):
                        break
                except OSError:
                    break
            return sent

    class AsyncConnection:
        """The same protocol for asyncio (Linux): each packet is one write
        into the transport, so packets never interleave, and drain() is bounded
        by send_timeout (a send that ran out leaves its packet queued whole, and
        is False). asyncio is imported by the calls that use it, so that
        a blocking peer starts without it."""

        def __init__(self, reader, writer, send_timeout=None):
            self.reader, self.writer, self.send_timeout = reader, writer, send_timeout

        @classmethod
        async def connect(cls, argv=None, send_timeout=None):
            import asyncio

            link = link_from_arguments(argv)
            if link is None:
                return None
            streams = await asyncio.open_unix_connection(sock=socket.socket(fileno=link))
            return cls(*streams, send_timeout)

        def close(self):
            self.writer.close()

        async def receive(self):
            import asyncio

            if self.reader is None:
                return None
            try:
                length, *fields = _header.unpack(await self.reader.readexactly(HEADER_SIZE))
                if HEADER_SIZE <= length <= MAX_SIZE:
                    return Packet(*fields, await self.reader.readexactly(length - HEADER_SIZE))
                self.reader = None  # the stream can't be trusted after a bad length
            except (OSError, asyncio.IncompleteReadError):
                pass
            return None

        async def read_version(self):
            first = await self.receive()
            return parse_version(first) if first is not None else None

        async def send(self, channel, type, flags=0, payload=b""):
            import asyncio

            block = encode(channel, type, flags, payload)
            if block is None or self.writer.is_closing():
                return False
            self.writer.write(block)
            try:
                await asyncio.wait_for(self.writer.drain(), self.send_timeout)
                return True
            except (OSError, asyncio.TimeoutError):
                return False

        async def execute(self, channel, flags, items):
            return await self.send(channel, EXECUTE, flags, _execute_payload(items))

        async def send_stdin(self, channel, data, close=False):
            return await self.send(channel, STDIN, STDIN_CLOSE if close else 0, data)

        async def send_ready(self):
            return await self.send(0, READY)

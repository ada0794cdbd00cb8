# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""A helper for tests of its clients: checks every caller in and answers as it is told, on a socket of its own.

It knows the wire only; nothing of the helper or of the client library is used.
"""
import array
import fcntl
import os
import socket
import struct
import threading

SERVICE = "com.norvale.brenvik.mobile-helper"
CHECK_IN = 4792174
NDR = bytes([0, 0, 0, 0, 1, 0, 0, 0])
COMPLEX = 0x80000000


class Request:
    def __init__(self, data, fds):
        self.data = data
        self.fds = fds
        _, _, self.reply_port, _, _, self.id = struct.unpack_from("<IIIIIi", data)

    def text(self, offset, size):
        return self.data[offset:offset + size].split(b"\0")[0].decode()

    def integer(self, offset=32):
        return struct.unpack_from("<i", self.data, offset)[0]

    def double(self, offset):
        return struct.unpack_from("<d", self.data, offset)[0]

    def region(self, descriptor_offset=28):
        """The bytes of an out-of-line region, however it travelled."""
        address, _, _, _, kind, size = struct.unpack_from("<QBBBBI", self.data, descriptor_offset)
        assert kind == 1
        if size == 0:
            return b""
        return self.data[address:address + size] if address else os.pread(self.fds[0], size, 0)

    # Replies.

    def _header(self, size, bits=18):
        return struct.pack("<IIIIIi", bits, size, 0, self.reply_port, 0, self.id + 100)

    def status(self, code, result=b""):
        return self._header(36 + len(result)) + NDR + struct.pack("<i", code) + result

    def boolean(self, value):
        return self.status(0, bytes([value, 0, 0, 0]))

    def string(self, text, size):
        return self.status(0, text.encode().ljust(size, b"\0"))

    def payload(self, data, in_line=True):
        address = 56 if data and in_line else 0
        reply = (self._header(56, COMPLEX | 18) + struct.pack("<I", 1)
                 + struct.pack("<QBBBBI", address, 1, 1, 0, 1, len(data)) + NDR + struct.pack("<I", len(data)))
        if in_line or not data:
            return reply + data
        memory = os.memfd_create("region", os.MFD_ALLOW_SEALING)
        os.write(memory, data)
        fcntl.fcntl(memory, 1033, 0x0002 | 0x0004 | 0x0008)  # F_ADD_SEALS: shrink, grow, write
        return reply, [memory]


def send(sock, message):
    data, fds = message if isinstance(message, tuple) else (message, [])
    rights = [(socket.SOL_SOCKET, socket.SCM_RIGHTS, array.array("i", fds))] if fds else []
    try:
        sock.sendmsg([data], rights)
    except (BrokenPipeError, ConnectionResetError):
        pass
    for fd in fds:
        os.close(fd)


def receive(sock):
    """The next request, or None at the end."""
    try:
        data, fds, _, _ = socket.recv_fds(sock, 65536, 4)
    except ConnectionResetError:
        return None
    return Request(data, fds) if data else None


class FakeHelper:
    """Listens at `path` until closed. `answer(request)` gives the reply: bytes, or (bytes, descriptors), or None for
    none. `refusal` is the code that check-ins are refused with."""

    def __init__(self, path, answer=None, refusal=0):
        self.answer = answer or (lambda request: request.status(0))
        self.refusal = refusal
        self.requests = []
        self.check_ins = []  # (request, reply), as bytes
        self.listening = socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET)
        self.listening.bind(str(path))
        self.listening.listen(8)
        self.thread = threading.Thread(target=self._accept, daemon=True)
        self.thread.start()

    def close(self):
        # Wakes the accepting thread.
        self.listening.shutdown(socket.SHUT_RDWR)
        self.thread.join(60)
        self.listening.close()

    def __enter__(self):
        return self

    def __exit__(self, *_):
        self.close()

    def _accept(self):
        while True:
            try:
                connection, _ = self.listening.accept()
            except OSError:
                return
            with connection:
                self._check_in(connection)

    def _check_in(self, connection):
        request = receive(connection)
        if request is None:
            return
        assert request.id == CHECK_IN and len(request.fds) == 1
        if self.refusal:
            os.close(request.fds[0])
            send(connection, request.status(self.refusal))
            return
        ours, theirs = socket.socketpair(socket.AF_UNIX, socket.SOCK_SEQPACKET)
        reply = (request._header(40, COMPLEX | 18) + struct.pack("<I", 1)
                 + struct.pack("<IIHBB", 0, 0, 0, 19, 0))
        self.check_ins.append((request.data, reply))
        send(connection, (reply, [theirs.detach()]))
        threading.Thread(target=self._serve, args=(ours, request.fds[0]), daemon=True).start()

    def _serve(self, channel, death_watch):
        with channel:
            while (request := receive(channel)) is not None:
                self.requests.append(request)
                reply = self.answer(request)
                if reply is not None:
                    send(channel, reply)
        os.close(death_watch)

# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The wire protocol, written from docs/protocol.md alone: no code of the helper is used here.

A Channel is one connected SOCK_SEQPACKET socket. Client checks in and has one method for each reply form.
"""
import array
import fcntl
import os
import socket
import struct

BOOTSTRAP = "/run/brenvik/bootstrap"
SERVICE = "com.norvale.brenvik.mobile-helper"
CHECK_IN = 4792174
NDR = bytes([0, 0, 0, 0, 1, 0, 0, 0])
COMPLEX = 0x80000000
LARGEST = 65536

FIRST = 8683549
ROUTINES = [
    # name, request size, reply form
    ("SetVoicemailToken", 288, "status"),
    ("SetVoicemailTokenForKey", 544, "status"),
    ("ClearVoicemailToken", 24, "status"),
    ("ResetVoicemailStore", 24, "status"),
    ("CopyVoicemailTokenForKey", 288, "string256"),
    ("CopyVoicemailToken", 24, "string256"),
    ("SetPreferenceValue", 568, "status"),
    ("CopyPreferenceValue", 544, "region"),
    ("CopyAppPreferenceValue", 544, "region"),
    ("ReplaceCarrierSymlink", 3104, "status"),
    ("CreateSymlink", 2080, "status"),
    ("RemoveCarrierFile", 2080, "status"),
    ("IsVoicemailServiceSubscribed", 24, "integer"),
    ("CellularHeartbeat", 36, "status"),
    ("CheckLASDUpdate", 36, "status"),
    ("CopyCarrierFile", 800, "integer"),
    ("CopyCrashLogs", 288, "integer"),
    ("MoveIntoCarrierBundles", 800, "integer"),
    ("RequestCountryCodeFromLocation", 48, "status"),
    ("CopyCountryCode", 24, "string64"),
    ("RequestWanIPFromLocation", 24, "status"),
    ("EnableRadioManagerLogs", 36, "status"),
    ("UnpackArchive", 544, "integer"),
    ("LoadPlistFile", 288, "region"),
    ("CopyBadgeLabels", 76, "region"),
    ("CopyLocalizedLabels", 76, "region"),
    ("RemapContactsChannel", 160, "integer"),
]
ID = {name: FIRST + index for index, (name, _, _) in enumerate(ROUTINES)}
SIZE = {name: size for name, size, _ in ROUTINES}


def header(message_id, size, bits=18, reply_port=0x1234):
    return struct.pack("<IIIIIi", bits, size, reply_port, 0, 0, message_id)


def field(text, size):
    raw = text.encode() if isinstance(text, str) else text
    assert len(raw) <= size
    return raw + bytes(size - len(raw))


def simple(name, *arguments, reply_port=0x1234):
    """A simple request; arguments are bytes already laid out."""
    body = b"".join(arguments)
    if body:
        body = NDR + body
    return header(ID[name], 24 + len(body), reply_port=reply_port) + body


def out_of_line(address, size, kind=1):
    return struct.pack("<QBBBBI", address, 0, 1, 0, kind, size)


def round_up(value, to=8):
    return (value + to - 1) // to * to


def memfd_of(data, seals=None):
    fd = os.memfd_create("region", os.MFD_CLOEXEC | os.MFD_ALLOW_SEALING)
    os.write(fd, data)
    if seals is None:
        seals = 0x0002 | 0x0004 | 0x0008  # shrink, grow, write
    if seals:
        fcntl.fcntl(fd, 1033, seals)  # F_ADD_SEALS
    return fd


class Closed(Exception):
    """The other side ended the channel."""


class Status(Exception):
    def __init__(self, code):
        super().__init__(f"status {code}")
        self.code = code


class Channel:
    def __init__(self, sock):
        self.sock = sock

    def fileno(self):
        return self.sock.fileno()

    def close(self):
        self.sock.close()

    def send(self, message, fds=()):
        ancillary = [(socket.SOL_SOCKET, socket.SCM_RIGHTS, array.array("i", fds))] if fds else []
        try:
            self.sock.sendmsg([message], ancillary)
        except (BrokenPipeError, ConnectionResetError) as error:
            raise Closed() from error

    def receive(self, timeout=10):
        """One message and its descriptors."""
        self.sock.settimeout(timeout)
        try:
            data, ancillary, flags, _ = self.sock.recvmsg(LARGEST, socket.CMSG_SPACE(253 * 4))
        except ConnectionResetError as error:
            raise Closed() from error
        fds = array.array("i")
        for level, kind, raw in ancillary:
            if level == socket.SOL_SOCKET and kind == socket.SCM_RIGHTS:
                fds.frombytes(raw[: len(raw) - len(raw) % 4])
        assert not flags & (socket.MSG_TRUNC | socket.MSG_CTRUNC)
        if not data and not fds:
            raise Closed()
        return data, list(fds)

    def exchange(self, message, fds=(), timeout=10):
        self.send(message, fds)
        return self.receive(timeout)

    def status(self, message, fds=(), timeout=10):
        """The code of the status reply to a message, the reply's own form checked."""
        reply, received = self.exchange(message, fds, timeout)
        assert not received
        return check_status(message, reply)


def check_status(request, reply, ndr=NDR):
    assert len(reply) == 36, f"{len(reply)} bytes: {reply!r}"
    bits, size, remote, local, voucher, message_id = struct.unpack_from("<IIIIIi", reply)
    assert bits == 18 and size == 36 and remote == 0 and voucher == 0, reply[:24]
    request_id, = struct.unpack_from("<i", request, 20)
    request_port, = struct.unpack_from("<I", request, 8)
    assert message_id == request_id + 100 and local == request_port, reply[:24]
    assert reply[24:32] == ndr, reply[24:32]
    return struct.unpack_from("<i", reply, 32)[0]


def connect(path=None, timeout=10):
    sock = socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET)
    sock.settimeout(timeout)
    try:
        sock.connect(str(path or f"{BOOTSTRAP}/{SERVICE}"))
    except OSError:
        sock.close()
        raise
    return Channel(sock)


def check_in_message(disposition=17, kind=0, count=1, bits=COMPLEX | 18):
    return (header(CHECK_IN, 40, bits=bits) + struct.pack("<I", count)
            + struct.pack("<IIHBB", 0, 0, 0, disposition, kind))


class Client:
    """A checked-in client. `life` is the port whose death ends it at the helper."""

    def __init__(self, path=None):
        self.life = None
        service = connect(path)
        try:
            self.life, theirs = socket.socketpair(socket.AF_UNIX, socket.SOCK_SEQPACKET)
            with theirs:
                message = check_in_message()
                reply, fds = service.exchange(message, [theirs.fileno()])
            if len(reply) == 36:
                raise Status(check_status(message, reply))
            bits, size, remote, local, voucher, message_id, count = struct.unpack_from("<IIIIIiI", reply)
            assert (bits, size, remote, local, voucher, message_id, count) == (
                COMPLEX | 18, 40, 0, 0x1234, 0, CHECK_IN + 100, 1), reply
            name, pad1, pad2, disposition, kind = struct.unpack_from("<IIHBB", reply, 28)
            assert (name, pad1, pad2, disposition, kind) == (0, 0, 0, 19, 0), reply
            assert len(reply) == 40 and len(fds) == 1
            self.channel = Channel(socket.socket(fileno=fds[0]))
        except BaseException:
            if self.life is not None:
                self.life.close()
            raise
        finally:
            service.close()

    def close(self):
        self.channel.close()
        self.life.close()

    def __enter__(self):
        return self

    def __exit__(self, *_):
        self.close()

    def status(self, name, *arguments):
        return self.channel.status(simple(name, *arguments))

    def body(self, message, fds=(), timeout=10):
        """The whole reply to a message; raises Status when it is a refusal."""
        reply, received = self.channel.exchange(message, fds, timeout)
        if len(reply) == 36:
            raise Status(check_status(message, reply))
        return reply, received

    def integer(self, name, *arguments):
        reply, fds = self.body(simple(name, *arguments))
        assert len(reply) == 40 and not fds and reply[37:40] == b"\0\0\0", reply
        return reply[36]

    def text(self, name, *arguments, size=256):
        reply, fds = self.body(simple(name, *arguments))
        assert len(reply) == 36 + size and not fds
        return reply[36:]

    def region(self, message, fds=(), timeout=10):
        """The out-of-line payload of a reply, however it travelled."""
        reply, received = self.body(message, fds, timeout)
        bits, size, _, _, _, _, count = struct.unpack_from("<IIIIIiI", reply)
        address, deallocate, copy, pad, kind, length = struct.unpack_from("<QBBBBI", reply, 28)
        assert (bits, size, count, deallocate, copy, pad, kind) == (COMPLEX | 18, 56, 1, 1, 1, 0, 1), reply[:56]
        assert reply[44:52] == NDR and struct.unpack_from("<I", reply, 52)[0] == length
        if length == 0:
            assert address == 0 and len(reply) == 56 and not received
            return b""
        if address:
            assert address == 56 and len(reply) == 56 + length and not received
            return reply[56:]
        assert len(reply) == 56 and len(received) == 1
        with os.fdopen(received[0], "rb") as memfd:
            assert fcntl.fcntl(memfd, 1034) & 0x000E == 0x000E  # F_GET_SEALS
            memfd.seek(0)
            data = memfd.read()
            assert len(data) == length
            return data

    def copy_preference(self, domain, key, name="CopyPreferenceValue"):
        return self.region(simple(name, field(domain, 256), field(key, 256)))

    def set_preference(self, domain, key, value, way="in line"):
        message, fds = set_preference_message(domain, key, value, way)
        try:
            return self.channel.status(message, fds)
        finally:
            for fd in fds:
                os.close(fd)

    def load_plist(self, path):
        return self.region(simple("LoadPlistFile", field(path, 256)))


def set_preference_message(domain, key, value, way="in line", size=None, length=None):
    """The request and the descriptors to send with it."""
    size = len(value) if size is None else size
    length = size if length is None else length
    total = SIZE["SetPreferenceValue"]
    address = round_up(total) if way == "in line" and size else 0
    message = (header(ID["SetPreferenceValue"], total, bits=COMPLEX | 18) + struct.pack("<I", 1)
               + out_of_line(address, size) + NDR + field(domain, 256) + field(key, 256) + struct.pack("<I", length))
    if way == "in line":
        return message + bytes(round_up(total) - total) + value, []
    return message, [memfd_of(value)] if value else []


def labels_message(name, labels, languages):
    total = SIZE[name]
    first = round_up(total)
    second = round_up(first + len(labels))
    message = (header(ID[name], total, bits=COMPLEX | 18) + struct.pack("<I", 2)
               + out_of_line(first if labels else 0, len(labels))
               + out_of_line(second if languages else 0, len(languages))
               + NDR + struct.pack("<II", len(labels), len(languages)))
    padded = message + bytes(first - total) + labels
    return padded + bytes(second - len(padded)) + languages

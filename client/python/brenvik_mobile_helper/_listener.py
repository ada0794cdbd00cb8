# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The telephony daemon's side: what the helper pushes and notifies."""
import os
import select
import socket
import stat
import struct
import threading
from time import monotonic

from . import _wire
from ._build import BOOTSTRAP_DIRECTORY
from ._errors import InvalidArgumentError, NameInUseError, NameLostError, NoLongerThereError, NotHandedOverError
from ._table import (BAD_ARGUMENTS, BAD_ID, COMPLEX, DESCRIPTORS, LARGEST, NDR, NOTIFICATION_ID, NOTIFICATION_SERVICE, PUSHES,
                     PUSH_REPLY_SIZE, PUSH_SERVICE, PUSH_SIZE, REPLY_ID, TYPE_ERROR, OUT_OF_LINE)

_FIRST_DESCRIPTOR = 3  # of a service manager
# The helper opens a connection for each message, so few are ever open at once.
_MOST_CONNECTIONS = 32
_RESULT = struct.Struct("<iII")


class Event:
    """A push or a notification. `values` is its dictionary as it came."""

    __slots__ = ("values", "sender_uid", "sender_pid", "_connection", "_message_id", "_port")

    def __init__(self, values: dict, sender_uid: int, sender_pid: int, connection, message_id: int, port: int):
        self.values = values
        self.sender_uid = sender_uid
        self.sender_pid = sender_pid
        self._connection = connection
        self._message_id = message_id
        self._port = port

    def __repr__(self):
        return f"{type(self).__name__}({self.values!r})"

    def _text(self, key: str) -> str:
        value = self.values.get(key)
        return value if isinstance(value, str) else ""

    @property
    def wants_reply(self) -> bool:
        """Whether the helper still waits for reply(), which it does for a second at most."""
        return self._port != 0

    def reply(self, code: int = 0, domain: int = 0) -> None:
        """Answers a push; code 0 is success. NoLongerThereError when the helper does not wait any more."""
        code, domain = _wire.integer(code, "code"), _wire.integer(domain, "domain")
        if not self._port:
            raise InvalidArgumentError("this event wants no reply, or has had one")
        port, self._port = self._port, 0
        header = _wire.HEADER.pack(_wire.SIMPLE_BITS, PUSH_REPLY_SIZE, 0, port, 0, self._message_id + REPLY_ID)
        try:
            self._connection.send(header + NDR + _RESULT.pack(code, domain & 0xFFFFFFFF, code & 0xFFFFFFFF))
        except OSError as error:
            raise NoLongerThereError from error


class CivicInfo(Event):
    """Where the phone is: the answer to request_country_code_from_location. What is not known is empty."""

    __slots__ = ()

    @property
    def country_code(self) -> str:
        return self._text("CountryCode")

    @property
    def state(self) -> str:
        return self._text("State")

    @property
    def city(self) -> str:
        return self._text("City")

    @property
    def postal_code(self) -> str:
        return self._text("PostalCode")


class LocalAddress(Event):
    """The phone's public address, empty when it has none: the answer to request_wan_ip_from_location."""

    __slots__ = ()

    @property
    def address(self) -> str:
        return self._text("Address")


class Notification(Event):
    """What became of an update check. `kind` is "UpdateAvailable", "NoUpdateRequired" or "UpdateFailed"."""

    __slots__ = ()

    @property
    def kind(self) -> str:
        return self._text("Notification").rpartition(".")[2]

    @property
    def database(self) -> str:
        """Which database was replaced: "gsm", "umts", "cdma", "lte" or "scdma"; else empty."""
        return self._text("DBType")


_KINDS = {"SetCivicInfoBasedOnCurrentLocation": CivicInfo, "SetLocalRoutableAddress": LocalAddress}


def _dictionary(region: bytes | None) -> dict:
    try:
        values = _wire.parsed(region)
    except _wire.ProtocolError as error:
        raise ValueError(str(error)) from None
    if not isinstance(values, dict):
        raise ValueError("the values are no dictionary")
    return values


def read_push(data: bytes, descriptors: list[int], is_cut: bool):
    """The class of the event, its values, its id and reply port; or the code that refuses it."""
    bits, _, port, _, _, message_id = _wire.HEADER.unpack_from(data)
    if is_cut:
        return BAD_ARGUMENTS
    if message_id not in PUSHES:
        return BAD_ID
    if not bits & COMPLEX or len(data) < PUSH_SIZE or data[24:28] != b"\1\0\0\0":
        return BAD_ARGUMENTS
    if data[DESCRIPTORS + 11] != OUT_OF_LINE:
        return TYPE_ERROR
    try:
        return _KINDS[PUSHES[message_id]], _dictionary(
            _wire.region_in(data, PUSH_SIZE, DESCRIPTORS, descriptors, False)), message_id, port
    except ValueError:
        return BAD_ARGUMENTS


class _Service:
    """A listening socket. A file that we made for it is removed with it, unless another stands there by then."""

    def __init__(self, sock: socket.socket, path: str | None = None):
        self.sock = sock
        self.path = path
        facts = os.stat(path, follow_symlinks=False) if path else None
        self.file = facts and (facts.st_dev, facts.st_ino)
        self.has_lost_name = False

    @property
    def is_named(self) -> bool:
        try:
            facts = os.stat(self.path or "", follow_symlinks=False)
        except OSError:
            return False
        return (facts.st_dev, facts.st_ino) == self.file

    def close(self):
        self.sock.close()
        if self.path and self.is_named:
            try:
                os.unlink(self.path)
            except OSError:
                pass


def _watch_names(paths: list[str]) -> int:
    """An inotify descriptor that is readable when something happens to one of the files; -1 when there can be none, and
    then a lost name is not noticed."""
    import ctypes  # Python itself has no inotify
    library = ctypes.CDLL(None)
    try:
        watch = library.inotify_init1(os.O_CLOEXEC | os.O_NONBLOCK)
        for each in paths if watch >= 0 else ():
            # IN_ATTRIB, which a removed file that is open still gets, IN_MOVE_SELF, IN_DELETE_SELF, IN_DONT_FOLLOW
            library.inotify_add_watch(watch, os.fsencode(each), 0x4 | 0x800 | 0x400 | 0x2000000)
    except AttributeError:
        return -1
    return watch


def listening_socket(path: str) -> socket.socket:
    """A listening socket at the path. A file that nobody serves is replaced; NameInUseError when somebody does."""
    if len(os.fsencode(path)) > 107:
        raise InvalidArgumentError(f"not a path for a socket: {path!r}")
    os.makedirs(os.path.dirname(path) or ".", mode=0o755, exist_ok=True)
    sock = socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET | socket.SOCK_NONBLOCK)
    try:
        try:
            sock.bind(path)
        except OSError:
            if not stat.S_ISSOCK(os.stat(path, follow_symlinks=False).st_mode):
                raise
            with socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET | socket.SOCK_NONBLOCK) as probe:
                try:
                    probe.connect(path)
                except ConnectionRefusedError:
                    pass
                except OSError as error:
                    raise NameInUseError(detail=path) from error
                else:
                    raise NameInUseError(detail=path)
            os.unlink(path)
            sock.bind(path)
        # Anyone may connect, whatever the umask; who may speak is decided by the credentials of the connection.
        os.chmod(path, 0o666)
        sock.listen(16)
        return sock
    except BaseException:
        sock.close()
        raise


def _is_service(sock: socket.socket) -> bool:
    return (sock.family == socket.AF_UNIX and sock.type == socket.SOCK_SEQPACKET
            and sock.getsockopt(socket.SOL_SOCKET, socket.SO_ACCEPTCONN) == 1)


class _TurnedAway:
    """Closes connections of strangers. What a stranger has put into one is closed with it, and a socket that lingers is
    closed when its maker likes. So a connection that is not empty is closed by a thread of its own; there are few, and
    nobody is to be accepted while all of them are busy."""

    MOST_THREADS = 16

    def __init__(self):
        self.event = os.eventfd(0, os.EFD_CLOEXEC | os.EFD_NONBLOCK)  # readable when there may be room again
        self._lock = threading.Lock()  # keeps a thread from writing to an event that was closed
        self._busy = 0

    def has_room(self) -> bool:
        return self._busy < self.MOST_THREADS

    def close(self, sock: socket.socket) -> None:
        # Nothing is put into it once it is shut. With credentials asked for, whatever is there shows as cut.
        try:
            sock.shutdown(socket.SHUT_RDWR)
            sock.setsockopt(socket.SOL_SOCKET, socket.SO_PASSCRED, 1)
            data, _, flags, _ = sock.recvmsg(1, 0, socket.MSG_PEEK | socket.MSG_DONTWAIT)
            if not data and not flags:
                sock.close()
                return
        except OSError:
            pass  # as one that is not empty
        with self._lock:
            self._busy += 1
        # It does not keep the interpreter from leaving.
        try:
            threading.Thread(target=self._close, args=(sock.detach(),), daemon=True).start()
        except RuntimeError:
            pass  # no thread: it stays open, and counts as one that is still being closed

    def _close(self, descriptor: int) -> None:
        os.close(descriptor)
        with self._lock:
            self._busy -= 1
            if self.event >= 0:
                os.eventfd_write(self.event, 1)

    def end(self) -> None:
        with self._lock:
            os.close(self.event)
            self.event = -1


class Listener:
    """Receives the helper's pushes and notifications, in the order they come.

        with Listener() as listener:
            for event in listener:
                print(event)

    Messages are taken from root and from this process's own user only, and from `allowed_uid` when it is given; others'
    connections are closed. Pushes are answered with success before they are handed over, unless `answer` is False: then
    event.reply() answers them, within a second. Messages that break the protocol are answered as the protocol says, and
    skipped.
    """

    def __init__(self, directory: "str | os.PathLike[str] | None" = None, *, pushes: bool = True, notifications: bool = True,
                 answer: bool = True, allowed_uid: int | None = None):
        """Makes the sockets in `directory` (None: the folder of named services, which only root may write)."""
        folder = BOOTSTRAP_DIRECTORY if directory is None else os.fsdecode(directory)
        services: dict[str, _Service] = {}
        self._prepare(answer, allowed_uid)
        try:
            for name, wanted in ((PUSH_SERVICE, pushes), (NOTIFICATION_SERVICE, notifications)):
                if wanted:
                    path = os.path.join(folder, name)
                    services[name] = _Service(listening_socket(path), path)
            self._open(services)
        except BaseException:
            for each in services.values():
                each.close()
            self.close()
            raise

    @classmethod
    def from_sockets(cls, pushes: socket.socket | None = None, notifications: socket.socket | None = None, *,
                     answer: bool = True, allowed_uid: int | None = None) -> "Listener":
        """Takes over listening sockets that somebody else made. It closes them; their files stay."""
        given = {name: sock for name, sock in ((PUSH_SERVICE, pushes), (NOTIFICATION_SERVICE, notifications))
                 if sock is not None}
        for sock in given.values():
            if not _is_service(sock):
                raise InvalidArgumentError("not a listening AF_UNIX socket of type SOCK_SEQPACKET")
        if pushes is not None and notifications is not None and pushes.fileno() == notifications.fileno():
            raise InvalidArgumentError("both services are the same socket")
        self = cls.__new__(cls)
        self._prepare(answer, allowed_uid)
        try:
            self._open({name: _Service(sock) for name, sock in given.items()})
        except BaseException:
            self._poll.close()
            self._turned_away.end()
            raise
        for sock in given.values():
            sock.setblocking(False)
            os.set_inheritable(sock.fileno(), False)
        return self

    @classmethod
    def from_environment(cls, *, answer: bool = True, allowed_uid: int | None = None) -> "Listener":
        """Takes over the sockets that the service manager handed to this process (LISTEN_FDS), found by their names, which
        are those of the services. NotHandedOverError when there is neither. May be called once."""
        found: dict[str, socket.socket] = {}
        try:
            if int(os.environ.get("LISTEN_PID", "-1")) == os.getpid():
                names = os.environ.get("LISTEN_FDNAMES", "").split(":")[:int(os.environ.get("LISTEN_FDS", "0"))]
                for number, name in enumerate(names, _FIRST_DESCRIPTOR):
                    if name in (PUSH_SERVICE, NOTIFICATION_SERVICE) and name not in found:
                        found[name] = socket.socket(fileno=number)
        except ValueError:
            pass  # variables that are no numbers were made by no service manager
        except OSError as error:
            for sock in found.values():
                sock.detach()
            raise InvalidArgumentError(f"what was handed over is no socket: {error.strerror}") from error
        if not found:
            raise NotHandedOverError
        try:
            return cls.from_sockets(found.get(PUSH_SERVICE), found.get(NOTIFICATION_SERVICE), answer=answer,
                                    allowed_uid=allowed_uid)
        except BaseException:
            for sock in found.values():
                sock.detach()
            raise

    def _prepare(self, answer, allowed_uid):
        self._answer = bool(answer)
        self._allowed = {0, os.geteuid()} | ({allowed_uid} if allowed_uid is not None else set())
        self._poll = select.epoll()
        self._turned_away = _TurnedAway()
        self._poll.register(self._turned_away.event, select.EPOLLIN)
        self._names = -1
        self._services: dict[int, tuple[str, _Service]] = {}
        self._connections: dict[int, tuple[socket.socket, str, int, int]] = {}  # the oldest first

    def _open(self, services: dict[str, _Service]):
        if not services:
            raise InvalidArgumentError("no service to listen on")
        for name, each in services.items():
            self._poll.register(each.sock, select.EPOLLIN)
            self._services[each.sock.fileno()] = name, each
        paths = [each.path for each in services.values() if each.path]
        if paths:
            self._names = _watch_names(paths)
            if self._names >= 0:
                self._poll.register(self._names, select.EPOLLIN)

    def __enter__(self):
        return self

    def __exit__(self, *_):
        self.close()

    def __iter__(self):
        return self

    def __next__(self) -> Event:
        event = self.next()
        assert event is not None
        return event

    def fileno(self) -> int:
        """A descriptor that is readable when next() has something to do; -1 when closed."""
        return -1 if self._poll.closed else self._poll.fileno()

    def close(self) -> None:
        """Stops listening, and removes the socket files that it made."""
        for sock, *_ in self._connections.values():
            sock.close()
        self._connections.clear()
        for _, each in self._services.values():
            each.close()
        self._services.clear()
        if not self._poll.closed:
            self._poll.close()
            self._turned_away.end()
        if self._names >= 0:
            os.close(self._names)
            self._names = -1

    def next(self, timeout: float | None = None) -> Event | None:
        """Waits for the next event, at most so many seconds (None: for ever); None when none came. NameLostError, once for
        each, when somebody has removed a socket file that it made; what is connected is still served."""
        deadline = None if timeout is None else monotonic() + timeout
        overtime = 0
        while True:
            left = -1.0 if deadline is None else max(deadline - monotonic(), 0.0)
            ready = self._poll.poll(left, 1)
            if not ready:
                if deadline is not None and monotonic() >= deadline:
                    return None
                continue
            event = self._handle(ready[0][0])
            if event is not None:
                return event
            if deadline is not None and monotonic() >= deadline:
                overtime += 1  # what is there already is still looked at, but not without end
                if overtime > 2 * _MOST_CONNECTIONS:
                    return None

    def _look_for_names(self) -> None:
        try:
            while os.read(self._names, 4096):
                pass
        except BlockingIOError:
            pass
        lost = []
        for _, each in self._services.values():
            is_lost = each.path is not None and not each.is_named
            if is_lost and not each.has_lost_name:
                lost.append(each.path)
            each.has_lost_name = is_lost
        if lost:
            raise NameLostError(detail=", ".join(map(str, lost)))

    def _handle(self, descriptor: int) -> Event | None:
        if descriptor == self._names:
            self._look_for_names()
            return None
        if descriptor == self._turned_away.event:
            os.eventfd_read(descriptor)
            self._look_for_connections(select.EPOLLIN)
            return None
        service = self._services.get(descriptor)
        if service is not None:
            self._accept(*service)
            return None
        return self._read(descriptor)

    def _look_for_connections(self, events: int) -> None:
        for _, each in self._services.values():
            self._poll.modify(each.sock, events)

    def _accept(self, name: str, service: _Service) -> None:
        if not self._turned_away.has_room():
            self._look_for_connections(0)
            return
        try:
            sock, _ = service.sock.accept()
        except (BlockingIOError, ConnectionAbortedError):
            return
        pid, uid, _ = struct.unpack("iII", sock.getsockopt(socket.SOL_SOCKET, socket.SO_PEERCRED, 12))
        if uid not in self._allowed:
            self._turned_away.close(sock)
            return
        if len(self._connections) >= _MOST_CONNECTIONS:  # the oldest has had its time
            self._end(next(iter(self._connections)))
        sock.setblocking(False)
        self._poll.register(sock, select.EPOLLIN)
        self._connections[sock.fileno()] = sock, name, uid, pid

    def _end(self, descriptor: int) -> None:
        sock = self._connections.pop(descriptor)[0]
        self._poll.unregister(sock)
        sock.close()

    def _read(self, descriptor: int) -> Event | None:
        sock, name, uid, pid = self._connections[descriptor]
        descriptors: list[int] = []
        try:
            data, ancillary, flags, _ = sock.recvmsg(LARGEST, _wire.ROOM_FOR_RIGHTS, socket.MSG_CMSG_CLOEXEC)
            descriptors = _wire.rights_in(ancillary)
        except BlockingIOError:
            return None
        except OSError:
            data, flags = b"", 0
        try:
            if not data:
                self._end(descriptor)
                return None
            if len(data) < 24:
                return None
            is_cut = bool(flags & (socket.MSG_TRUNC | socket.MSG_CTRUNC))
            if name == PUSH_SERVICE:
                return self._push(sock, data, descriptors, is_cut, uid, pid)
            return self._notification(sock, data, descriptors, is_cut, uid, pid)
        finally:
            _wire.close_all(descriptors)

    def _refuse(self, sock, data, code) -> None:
        _, _, port, _, _, message_id = _wire.HEADER.unpack_from(data)
        if port:
            try:
                sock.send(_wire.status_reply(message_id, port, code))
            except OSError:
                pass  # it has gone, or does not read its answers

    def _push(self, sock, data, descriptors, is_cut, uid, pid) -> Event | None:
        push = read_push(data, descriptors, is_cut)
        if isinstance(push, int):
            self._refuse(sock, data, push)
            return None
        kind, values, message_id, port = push
        event = kind(values, uid, pid, sock, message_id, port)
        if self._answer and port:
            try:
                event.reply()
            except NoLongerThereError:
                pass  # what it says is true all the same
        return event

    def _notification(self, sock, data, descriptors, is_cut, uid, pid) -> Event | None:
        message_id = _wire.HEADER.unpack_from(data)[5]
        if message_id != NOTIFICATION_ID or is_cut or descriptors:
            self._refuse(sock, data, BAD_ID if message_id != NOTIFICATION_ID else BAD_ARGUMENTS)
            return None
        try:
            return Notification(_dictionary(data[24:]), uid, pid, sock, message_id, 0)
        except ValueError:
            return None

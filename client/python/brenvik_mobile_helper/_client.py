# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The blocking client."""
import _thread
import os
import select
import socket
from time import monotonic, sleep

from . import _wire
from ._build import BOOTSTRAP_DIRECTORY
from ._errors import (AnswerLostError, HelperError, HelperGoneError, InvalidArgumentError, NotConnectedError, ProtocolError,
                      RefusedError, TimedOutError, UnreachableError)
from ._routines import Routines
from ._table import BAD_ID, CHECK_IN, LARGEST, ROUTINES, SERVICE, Routine

DEFAULT_TIMEOUT = 30.0
# After pauses of 1, 2, 4 ... 512 ms: about a second, many times what a helper needs to be started anew.
_TRIES = 11
_SEND = socket.MSG_DONTWAIT | socket.MSG_NOSIGNAL
_RECEIVE = socket.MSG_DONTWAIT | socket.MSG_CMSG_CLOEXEC
_CUT = socket.MSG_TRUNC | socket.MSG_CTRUNC
_ROOM = 1024


def service_socket() -> str:
    """Where the helper's service socket is, as it was built."""
    return f"{BOOTSTRAP_DIRECTORY}/{SERVICE}"


def path_of(path) -> str:
    path = service_socket() if path is None else os.fspath(path)
    if not path or len(os.fsencode(path)) > 107 or "\0" in os.fsdecode(path):
        raise InvalidArgumentError(f"not a path for a socket: {path!r}")
    return path


def time_of(seconds) -> float:
    seconds = DEFAULT_TIMEOUT if seconds is None else _wire.real(seconds, "timeout")
    if not 0 < seconds < 1e9:
        raise InvalidArgumentError("a time-out must be more than 0 seconds")
    return seconds


def _left(deadline: float) -> float:
    left = deadline - monotonic()
    if left <= 0:
        raise TimedOutError
    return left


def _try_check_in(path: str, deadline: float):
    """The channel and our end of the death-watch port."""
    service = socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET)
    ours = theirs = None
    descriptors: list[int] = []
    try:
        try:
            while True:
                service.settimeout(_left(deadline))
                try:
                    service.connect(path)
                    break
                except BlockingIOError:  # a full backlog
                    sleep(min(0.005, _left(deadline)))
        except PermissionError as error:
            raise RefusedError(detail="the account is not in the group that may connect") from error
        except TimeoutError as error:
            raise TimedOutError from error
        except OSError as error:
            raise UnreachableError(detail=f"{path}: {error.strerror}") from error
        ours, theirs = socket.socketpair(socket.AF_UNIX, socket.SOCK_SEQPACKET)
        try:
            socket.send_fds(service, [_wire.check_in_message(1)], [theirs.fileno()], socket.MSG_NOSIGNAL)
            theirs.close()
            service.settimeout(_left(deadline))
            data, ancillary, flags, _ = service.recvmsg(LARGEST, _wire.ROOM_FOR_RIGHTS, socket.MSG_CMSG_CLOEXEC)
        except (BrokenPipeError, ConnectionResetError) as error:
            raise HelperGoneError from error
        except TimeoutError as error:
            raise TimedOutError from error
        descriptors = _wire.rights_in(ancillary)
        if not data:
            raise HelperGoneError
        if len(data) >= 24 and _wire.HEADER.unpack_from(data)[3] != 1:
            raise ProtocolError(detail="the answer is to something else")
        _wire.read_reply(CHECK_IN, data, descriptors, bool(flags & (socket.MSG_TRUNC | socket.MSG_CTRUNC)))
        channel = socket.socket(fileno=descriptors.pop())
        channel.setblocking(True)  # the helper may have made the pair for its own use
        death_watch, ours = ours, None
        return channel, death_watch
    finally:
        _wire.close_all(descriptors)
        service.close()
        for each in (ours, theirs):
            if each is not None:
                each.close()


def check_in(path: str, timeout: float):
    """Checks in at the helper, several times where it is between two lives."""
    deadline = monotonic() + timeout
    had_left = False
    for attempt in range(_TRIES):
        try:
            return _try_check_in(path, deadline)
        except HelperGoneError:
            had_left = True
            if attempt == _TRIES - 1:
                raise
        except UnreachableError:
            # Between two lives the socket may be missing for a moment.
            if not had_left or attempt == _TRIES - 1:
                raise
        left = deadline - monotonic()
        if left <= 0:
            raise TimedOutError
        sleep(min(0.001 * (1 << attempt), left))
    raise HelperGoneError


class Client(Routines):
    """Asks the helper, one request at a time, and waits for each answer. Threads may share it: they take turns.

        with Client() as helper:
            helper.set_voicemail_token("token")

    It checks in with the first call, or with connect(). When the helper has left since the last call, a call checks in
    again, once, and only while its request has certainly not been carried out.
    """

    def __init__(self, path: "str | os.PathLike[str] | None" = None, *, timeout: float | None = None):
        """`path`: the helper's service socket, for tests; None: the place it was built with. `timeout`: seconds that one
        call may take in all; None: 30."""
        self._path = path_of(path)
        self._timeout = time_of(timeout)
        self._lock = _thread.allocate_lock()
        self._channel: socket.socket | None = None
        self._death_watch: socket.socket | None = None
        self._poll: select.poll | None = None
        self._polled = 0
        self._last_port = 0
        self._unanswered: set[int] = set()
        self._closed = False

    def __enter__(self):
        self.connect()
        return self

    def __exit__(self, *_):
        self.close()

    def __del__(self):
        if hasattr(self, "_lock"):
            self._drop()

    @property
    def timeout(self) -> float:
        """Seconds that one call may take in all."""
        return self._timeout

    @timeout.setter
    def timeout(self, seconds: float | None) -> None:
        self._timeout = time_of(seconds)

    def connect(self) -> None:
        """Checks in, unless that was done already. A closed client can be used again after it."""
        with self._lock:
            self._closed = False
            if self._channel is None:
                self._connect(self._timeout)

    def close(self) -> None:
        """Leaves the helper, which drops what it kept for this client. Calls fail until connect()."""
        with self._lock:
            self._closed = True
            self._drop()

    def _drop(self):
        for each in (self._channel, self._death_watch):
            if each is not None:
                each.close()
        self._channel = self._death_watch = self._poll = None
        self._polled = 0
        self._unanswered.clear()

    def _connect(self, timeout: float) -> socket.socket:
        channel, self._death_watch = check_in(self._path, timeout)
        self._channel = channel
        return channel

    def _wait(self, channel: socket.socket, events: int, start: float) -> None:
        poll = self._poll
        if poll is None:
            poll = self._poll = select.poll()
        if events != self._polled:
            poll.register(channel, events)
            self._polled = events
        left = start + self._timeout - monotonic()
        if left <= 0 or not poll.poll(left * 1000):
            raise TimedOutError

    def _send_and_wait(self, channel: socket.socket, message: bytes, memories, port: int, room: int, start: float):
        """The answer's bytes, its descriptors, and whether it was cut."""
        # Noted before it is sent: a signal handler may raise right after.
        self._unanswered.add(port)
        # The socket blocks, but each call says that it must not: a time-out of Python's own would cost two system calls more.
        while True:
            try:
                if memories:
                    socket.send_fds(channel, [message], memories, _SEND)
                else:
                    channel.send(message, _SEND)
                break
            except BlockingIOError:
                self._wait(channel, select.POLLOUT, start)
            except (BrokenPipeError, ConnectionResetError) as error:
                raise HelperGoneError from error
        while True:
            self._wait(channel, select.POLLIN, start)
            try:
                data, ancillary, flags, _ = channel.recvmsg(room, _wire.ROOM_FOR_RIGHTS, _RECEIVE)
            except BlockingIOError:
                continue
            except ConnectionResetError as error:
                # The kernel says so when the peer left datagrams unread, and ours is the last one sent.
                raise HelperGoneError from error
            descriptors = _wire.rights_in(ancillary) if ancillary else None
            if not data:
                _wire.close_all(descriptors or ())
                raise AnswerLostError
            answered = _wire.HEADER.unpack_from(data)[3] if len(data) >= 24 else 0
            if answered not in self._unanswered:
                _wire.close_all(descriptors or ())
                raise ProtocolError(detail="the answer is to something else")
            self._unanswered.discard(answered)
            if answered == port:
                return data, descriptors, bool(flags & _CUT)
            # A late answer to a request that was given up.
            _wire.close_all(descriptors or ())

    def _ask(self, routine: Routine, body: bytes, memories=()):
        """Sends a request, given without its header, and returns what read_reply makes of the answer."""
        with self._lock:
            start = monotonic()
            has_checked_in = False
            bits = _wire.COMPLEX_BITS if routine.descriptors else _wire.SIMPLE_BITS
            # A longer answer is none of a correct helper's, and less room is quicker made.
            room = LARGEST if routine.reply == "region" else _ROOM
            while True:
                channel = self._channel
                if channel is None:
                    if self._closed:
                        raise NotConnectedError
                    channel = self._connect(self._timeout - (monotonic() - start))
                    has_checked_in = True
                port = self._last_port = self._last_port % 0xFFFFFFFE + 1
                message = _wire.HEADER.pack(bits, routine.request_size, port, 0, 0, routine.id) + body
                descriptors = None
                try:
                    data, descriptors, is_cut = self._send_and_wait(channel, message, memories, port, room, start)
                    return _wire.read_reply(routine, data, descriptors, is_cut)
                except HelperGoneError:
                    self._drop()
                    if has_checked_in:
                        raise
                except (AnswerLostError, ProtocolError):
                    self._drop()
                    raise
                finally:
                    if descriptors:
                        _wire.close_all(descriptors)

    def _ask_complex(self, routine: Routine, rest: bytes, regions):
        body, memories = _wire.with_regions(routine.request_size, rest, regions)
        try:
            return self._ask(routine, body, memories)
        finally:
            _wire.close_all(memories)

    def ping(self) -> None:
        """Asks whether the helper is there and lets this program in. Raises when not."""
        self.connect()
        try:
            self._ask(_wire.NOTHING, b"")
        except HelperError as error:
            if error.code != BAD_ID:
                raise

    def call(self, name: str, /, **arguments):
        """Calls a routine by its name in the protocol's table, with arguments named as there.

        Regions are bytes, both ways, and are sent as they are: a value that is a property list already need not be made
        anew. A region without a value is None.
        """
        routine = ROUTINES.get(name)
        if routine is None:
            raise InvalidArgumentError(f"there is no routine {name}")
        rest, regions = _wire.pack(routine, arguments)
        return self._ask_complex(routine, rest, regions) if regions else self._ask(routine, rest)


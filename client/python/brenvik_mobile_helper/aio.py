# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The same for asyncio. A module of its own, because asyncio costs more to import than all the rest."""
import asyncio
import os
import socket
from collections import deque

from . import _wire
from ._async_routines import AsyncRoutines
from ._client import check_in, path_of, time_of
from ._errors import (AnswerLostError, HelperError, HelperGoneError, InvalidArgumentError, NotConnectedError, ProtocolError,
                      TimedOutError)
from ._listener import Event, Listener
from ._table import BAD_ID, LARGEST, ROUTINES, Routine

__all__ = ["AsyncClient", "AsyncListener"]


class AsyncClient(AsyncRoutines):
    """Asks the helper without blocking the event loop. Several calls may be under way; the helper answers in order.

        async with AsyncClient() as helper:
            country, token = await asyncio.gather(helper.copy_country_code(), helper.copy_voicemail_token())

    A call that was cancelled, or ran out of time, may still be carried out; its answer is recognised and dropped.
    """

    def __init__(self, path: "str | os.PathLike[str] | None" = None, *, timeout: float | None = None):
        self._path = path_of(path)
        self._timeout = time_of(timeout)
        self._channel: socket.socket | None = None
        self._death_watch: socket.socket | None = None
        self._connecting: asyncio.Lock | None = None
        self._last_port = 0
        self._pending: dict[int, tuple[Routine, asyncio.Future]] = {}  # by reply port, in the order they were sent
        self._waiting: deque[asyncio.Future] = deque()  # for room in the channel
        self._loop: asyncio.AbstractEventLoop | None = None
        self._closed = False

    async def __aenter__(self):
        await self.connect()
        return self

    async def __aexit__(self, *_):
        self.close()

    def __del__(self):
        for each in (getattr(self, "_channel", None), getattr(self, "_death_watch", None)):
            if each is not None:
                each.close()

    async def connect(self) -> None:
        """Checks in, unless that was done already. A closed client can be used again after it."""
        self._closed = False
        async with self._timed():
            await self._connect()

    def close(self) -> None:
        """Leaves the helper. Calls under way end with NotConnectedError."""
        self._closed = True
        self._drop(lambda _: NotConnectedError())

    def _timed(self):
        return _Timed(self._timeout)

    async def _connect(self):
        """True when it had to check in."""
        if self._connecting is None:
            self._connecting = asyncio.Lock()
        async with self._connecting:
            if self._channel is not None:
                return False
            self._loop = asyncio.get_running_loop()
            # A check-in is short and rare; a thread can wait for it with the code of the blocking client.
            work = self._loop.run_in_executor(None, check_in, self._path, self._timeout)
            try:
                channel, death_watch = await asyncio.shield(work)
            except asyncio.CancelledError:
                work.add_done_callback(_close_result)
                raise
            if self._closed:
                channel.close()
                death_watch.close()
                raise NotConnectedError
            channel.setblocking(False)
            self._channel, self._death_watch = channel, death_watch
            self._loop.add_reader(channel.fileno(), self._read)
            return True

    def _drop(self, failure):
        """Closes the channel; failure(number) makes the exception of each call under way, the first of which is 0."""
        if self._channel is not None:
            if self._loop is not None and not self._loop.is_closed():
                self._loop.remove_reader(self._channel.fileno())
                self._loop.remove_writer(self._channel.fileno())
            self._channel.close()
            self._death_watch.close()
            self._channel = self._death_watch = None
        pending, self._pending = list(self._pending.values()), {}
        for number, (_, future) in enumerate(pending):
            if not future.done():
                future.set_exception(failure(number))
        self._wake()

    def _wake(self):
        while self._waiting:
            future = self._waiting.popleft()
            if not future.done():
                future.set_result(None)

    def _read(self):
        descriptors: list[int] = []
        try:
            data, ancillary, flags, _ = self._channel.recvmsg(LARGEST, _wire.ROOM_FOR_RIGHTS, socket.MSG_CMSG_CLOEXEC)
            descriptors = _wire.rights_in(ancillary)
        except (BlockingIOError, InterruptedError):
            return
        except OSError:
            # The helper left datagrams unread. It reads a request when it has answered the one before, so all but the first
            # of several were not carried out; of one alone the kernel says that it was left.
            is_alone = len(self._pending) == 1
            self._drop(lambda number: HelperGoneError() if number or is_alone else AnswerLostError())
            return
        try:
            if not data:
                self._drop(lambda _: AnswerLostError())
                return
            port = _wire.HEADER.unpack_from(data)[3] if len(data) >= 24 else 0
            if port not in self._pending:
                self._drop(lambda _: ProtocolError(detail="an answer to something else came"))
                return
            routine, future = self._pending.pop(port)
            try:
                result = _wire.read_reply(routine, data, descriptors, bool(flags & (socket.MSG_TRUNC | socket.MSG_CTRUNC)))
            except ProtocolError as error:
                if not future.done():
                    future.set_exception(error)
                self._drop(lambda _: AnswerLostError())
            except HelperError as error:
                if not future.done():
                    future.set_exception(error)
            else:
                if not future.done():
                    future.set_result(result)
        finally:
            _wire.close_all(descriptors)

    def _writable(self):
        self._loop.remove_writer(self._channel.fileno())
        self._wake()

    async def _send(self, message, memories):
        """Sends when there is room; True when the channel that it was meant for is still there."""
        while True:
            channel = self._channel
            if channel is None:
                return False
            if not self._waiting or self._waiting[0].done():
                try:
                    if memories:
                        socket.send_fds(channel, [message], memories, socket.MSG_NOSIGNAL)
                    else:
                        channel.send(message)
                    return True
                except (BlockingIOError, InterruptedError):
                    pass
                except OSError:
                    # Nothing was delivered. What was sent before may have been read.
                    self._drop(lambda _: AnswerLostError())
                    return False
            future = self._loop.create_future()
            self._waiting.append(future)
            self._loop.add_writer(channel.fileno(), self._writable)
            await future

    async def _ask(self, routine: Routine, body: bytes, memories=()):
        if self._closed:
            raise NotConnectedError
        async with self._timed():
            has_checked_in = False
            while True:
                if self._channel is None:
                    if self._closed:
                        raise NotConnectedError
                    if has_checked_in:
                        raise HelperGoneError
                    has_checked_in = await self._connect()
                port = self._last_port = self._last_port % 0xFFFFFFFE + 1
                bits = _wire.COMPLEX_BITS if routine.descriptors else _wire.SIMPLE_BITS
                message = _wire.HEADER.pack(bits, routine.request_size, port, 0, 0, routine.id) + body
                if not await self._send(message, memories):
                    continue
                future = asyncio.get_running_loop().create_future()
                self._pending[port] = routine, future
                try:
                    return await future
                except HelperGoneError:
                    if has_checked_in:
                        raise

    async def _ask_complex(self, routine: Routine, rest: bytes, regions):
        body, memories = _wire.with_regions(routine.request_size, rest, regions)
        try:
            return await self._ask(routine, body, memories)
        finally:
            _wire.close_all(memories)

    async def ping(self) -> None:
        """Asks whether the helper is there and lets this program in. Raises when not."""
        try:
            await self._ask(_wire.NOTHING, b"")
        except HelperError as error:
            if error.code != BAD_ID:
                raise

    async def call(self, name: str, /, **arguments):
        """Calls a routine by its name in the protocol's table; see Client.call."""
        routine = ROUTINES.get(name)
        if routine is None:
            raise InvalidArgumentError(f"there is no routine {name}")
        rest, regions = _wire.pack(routine, arguments)
        return await (self._ask_complex(routine, rest, regions) if regions else self._ask(routine, rest))


class _Timed:
    """asyncio.timeout with this package's exception."""

    def __init__(self, seconds):
        self._timeout = asyncio.timeout(seconds)

    async def __aenter__(self):
        await self._timeout.__aenter__()

    async def __aexit__(self, kind, error, trace):
        try:
            await self._timeout.__aexit__(kind, error, trace)
        except TimeoutError as late:
            if not isinstance(late, TimedOutError):
                raise TimedOutError from late
            raise


def _close_result(work):
    if not work.cancelled() and work.exception() is None:
        for each in work.result():
            each.close()


class AsyncListener:
    """Receives pushes and notifications as an async iterator; arguments are those of Listener.

        async with AsyncListener() as listener:
            async for event in listener:
                print(event)
    """

    def __init__(self, *arguments, **options):
        self._listener = Listener(*arguments, **options)

    @classmethod
    def from_sockets(cls, *arguments, **options) -> "AsyncListener":
        """See Listener.from_sockets."""
        self = cls.__new__(cls)
        self._listener = Listener.from_sockets(*arguments, **options)
        return self

    @classmethod
    def from_environment(cls, **options) -> "AsyncListener":
        """See Listener.from_environment."""
        self = cls.__new__(cls)
        self._listener = Listener.from_environment(**options)
        return self

    async def __aenter__(self):
        return self

    async def __aexit__(self, *_):
        self.close()

    def __aiter__(self):
        return self

    async def __anext__(self) -> Event:
        if self._listener.fileno() < 0:
            raise StopAsyncIteration
        while (event := self._listener.next(0)) is None:
            await self._readable()
        return event

    async def _readable(self):
        loop = asyncio.get_running_loop()
        future = loop.create_future()
        descriptor = self._listener.fileno()
        loop.add_reader(descriptor, lambda: future.done() or future.set_result(None))
        try:
            await future
        finally:
            loop.remove_reader(descriptor)

    def close(self) -> None:
        """Stops listening, and removes the socket files that it made."""
        self._listener.close()

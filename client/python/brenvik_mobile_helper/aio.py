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
        # What the channel had no room for yet: reply port, routine, message, its descriptors, and who waits.
        self._outgoing: deque[tuple[int, Routine, bytes, tuple | list, asyncio.Future]] = deque()
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
        await self._connect_until(asyncio.get_running_loop().time() + self._timeout)

    def close(self) -> None:
        """Leaves the helper. Calls under way end with NotConnectedError."""
        self._closed = True
        self._drop(lambda _: NotConnectedError())

    async def _connect_until(self, end: float) -> bool:
        try:
            async with asyncio.timeout_at(end):
                return await self._connect()
        except TimedOutError:
            raise
        except TimeoutError as error:
            raise TimedOutError from error

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
        unsent, self._outgoing = self._outgoing, deque()
        for *_, future in unsent:
            if not future.done():
                future.set_exception(NotConnectedError() if self._closed else HelperGoneError())

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

    def _flush(self):
        """Sends what there is room for."""
        channel = self._channel
        while self._outgoing:
            port, routine, message, memories, future = self._outgoing[0]
            if not future.done():
                try:
                    if memories:
                        socket.send_fds(channel, [message], memories, socket.MSG_NOSIGNAL)
                    else:
                        channel.send(message)
                except (BlockingIOError, InterruptedError):
                    self._loop.add_writer(channel.fileno(), self._flush)
                    return
                except OSError:
                    break  # the helper has gone: what it answered before is still read, then the end is
                self._pending[port] = routine, future
            self._outgoing.popleft()
        self._loop.remove_writer(channel.fileno())

    async def _ask(self, routine: Routine, body: bytes, memories=()):
        if self._closed:
            raise NotConnectedError
        loop = asyncio.get_running_loop()
        end = loop.time() + self._timeout
        has_checked_in = False
        while True:
            if self._channel is None:
                if has_checked_in:
                    raise HelperGoneError
                if self._closed:
                    raise NotConnectedError
                has_checked_in = await self._connect_until(end)
            port = self._last_port = self._last_port % 0xFFFFFFFE + 1
            bits = _wire.COMPLEX_BITS if routine.descriptors else _wire.SIMPLE_BITS
            message = _wire.HEADER.pack(bits, routine.request_size, port, 0, 0, routine.id) + body
            future = loop.create_future()
            timer = loop.call_at(end, _set_late, future)
            self._outgoing.append((port, routine, message, memories, future))
            if len(self._outgoing) == 1:
                self._flush()
            try:
                return await future
            except HelperGoneError:
                if has_checked_in:
                    raise
            finally:
                timer.cancel()

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


def _set_late(future):
    if not future.done():
        future.set_exception(TimedOutError())


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

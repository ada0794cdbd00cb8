# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The mock itself: serves the protocol as a script says."""
import asyncio
import os
import plistlib
import shutil
import socket
import tempfile
import threading
from time import monotonic

from .. import _wire
from .._client import Client
from .._errors import Error, HelperError
from .._listener import listening_socket
from .._table import (BAD_ARGUMENTS, BAD_ID, CHECK_IN, CHECK_IN_DISPOSITION, CHECK_IN_REPLY_DISPOSITION, COMPLEX, LARGEST, NDR,
                      NOTIFICATION_SERVICE, PORT, PUSHES, PUSH_CLIENT_KEY, PUSH_SERVICE, PUSH_SIZE, REPLY_ID, ROUTINES, SERVICE,
                      TYPE_ERROR, Routine)
from ._script import Push, Rule, Script, default_value, parse

# What a request that no rule fits is answered with: "not in this build of the helper".
NOT_SCRIPTED = 46
_BY_ID = {each.id: each for each in ROUTINES.values()}
_PUSH_IDS = {name: number for number, name in PUSHES.items()}
# The helper waits so long for the answer to a push.
_PUSH_TIME = 1.0


class Request:
    """A request as it came. `code` is what a wrong one is answered with; else 0."""

    def __init__(self, data: bytes, descriptors: list[int], is_cut: bool):
        bits, _, self.port, _, _, self.id = _wire.HEADER.unpack_from(data)
        self.routine = _BY_ID.get(self.id)
        self.arguments: dict = {}
        self.code = BAD_ID if self.routine is None else 0
        if self.routine is not None:
            try:
                if is_cut or bool(bits & COMPLEX) != bool(self.routine.descriptors):
                    raise ValueError
                self.arguments = _wire.unpack(self.routine, data, descriptors)
            except _wire.WrongDescriptor:
                self.code = TYPE_ERROR
            except ValueError:
                self.code = BAD_ARGUMENTS


def answer_to(request: Request, value, in_memory: bool = False) -> tuple[bytes, list[int]]:
    """The reply that carries a value, and the descriptors for it, which the caller closes."""
    routine = request.routine
    assert routine is not None
    if routine.reply == "boolean":
        return _wire.status_reply(request.id, request.port, 0, bytes([bool(value), 0, 0, 0])), []
    if routine.reply.startswith("text"):
        return _wire.status_reply(request.id, request.port, 0, value.encode().ljust(int(routine.reply[5:]), b"\0")), []
    if routine.reply == "status":
        return _wire.status_reply(request.id, request.port, 0), []
    region = value or b""
    rest = NDR + len(region).to_bytes(4, "little")
    if in_memory and region:
        memory = _wire.sealed_memory(region)
        body = (1).to_bytes(4, "little") + _wire.REGION.pack(0, 1, 1, 0, 1, len(region)) + rest
        memories = [memory]
    else:
        body, memories = _wire.with_regions(_wire.REGION_SIZE, rest, [region], deallocate=1)
    header = _wire.HEADER.pack(_wire.COMPLEX_BITS, _wire.REGION_SIZE, 0, request.port, 0, request.id + REPLY_ID)
    return header + body, memories


class Mock:
    """A helper that does what its script says, in a folder of its own.

    With `with`, it runs on a thread; `path` is its service socket, and `directory` the folder of named services, in which
    a program under test listens for pushes. The program runs it with serve() instead.
    """

    def __init__(self, script: "str | Script" = "", *, directory: "str | os.PathLike[str] | None" = None, log=None,
                 upstream: "str | os.PathLike[str] | None" = None, recorder=None):
        """`log(routine name, arguments, outcome)` is called for each request. With `upstream`, a real helper's socket, it
        is asked instead of the script, and `recorder`, a Recorder, is told."""
        self.script = parse(script) if isinstance(script, str) else script
        self._own_folder = directory is None
        self.directory = tempfile.mkdtemp(prefix="brenvik-mock-") if directory is None else os.fspath(directory)
        self.path = os.path.join(self.directory, SERVICE)
        self.unscripted: list[str] = []
        self.requests: list[tuple[str, dict]] = []
        self._log = log
        self._upstream = upstream
        self._recorder = recorder
        self._complain = lambda error: None  # called when the real helper does not let the mock in
        self._listening = None
        self._tasks: set = set()
        self._check_ins = [list(each) for each in self.script.check_ins]
        self._thread: threading.Thread | None = None
        self._loop: asyncio.AbstractEventLoop | None = None
        self._stop: asyncio.Event | None = None
        self._failure: BaseException | None = None
        try:
            self._listening = listening_socket(self.path)
            os.chmod(self.path, 0o600)
        except BaseException:
            self._remove()
            raise

    # ---- on a thread ----

    def __enter__(self):
        self._thread = threading.Thread(target=self._run, name="mock", daemon=True)
        self._thread.start()
        return self

    def __exit__(self, *_):
        self.close()

    def _run(self):
        try:
            asyncio.run(self.serve())
        except BaseException as error:  # for close(), on the other thread
            self._failure = error

    def close(self) -> None:
        """Ends the thread and removes the socket."""
        if self._thread is not None:
            while self._thread.is_alive():
                if self._stop is not None and self._loop is not None:
                    try:
                        self._loop.call_soon_threadsafe(self._stop.set)
                    except RuntimeError:
                        pass  # it has just ended
                self._thread.join(0.05)
            self._thread = None
        self._remove()
        if self._failure is not None:
            raise self._failure

    def _remove(self):
        if self._listening is not None:
            self._listening.close()
            self._listening = None
            try:
                os.unlink(self.path)
            except OSError:
                pass
        if self._own_folder:
            shutil.rmtree(self.directory, ignore_errors=True)

    # ---- serving ----

    async def serve(self) -> None:
        """Serves until stop() is called or the task is cancelled."""
        self._loop = asyncio.get_running_loop()
        self._stop = asyncio.Event()
        listening = self._listening
        assert listening is not None
        self._loop.add_reader(listening.fileno(), self._accept)
        try:
            await self._stop.wait()
        finally:
            self._loop.remove_reader(listening.fileno())
            for each in list(self._tasks):
                each.cancel()
            await asyncio.gather(*self._tasks, return_exceptions=True)

    def stop(self) -> None:
        if self._stop is not None:
            self._stop.set()

    def _begin(self, work):
        task = asyncio.get_running_loop().create_task(work)
        self._tasks.add(task)
        task.add_done_callback(self._ended)

    def _ended(self, task):
        self._tasks.discard(task)
        if not task.cancelled() and task.exception() is not None:
            self._failure = task.exception()
            self.stop()

    def _accept(self):
        try:
            sock, _ = self._listening.accept()
        except OSError:
            return
        sock.setblocking(False)
        self._begin(self._serve_client(sock))

    async def _readable(self, sock):
        future = asyncio.get_running_loop().create_future()
        asyncio.get_running_loop().add_reader(sock.fileno(), lambda: future.done() or future.set_result(None))
        try:
            await future
        finally:
            asyncio.get_running_loop().remove_reader(sock.fileno())

    async def _receive(self, sock, flags: int = 0):
        """A message, its descriptors, whether it was cut; the message is empty at the end."""
        while True:
            try:
                data, ancillary, got, _ = sock.recvmsg(LARGEST, _wire.ROOM_FOR_RIGHTS, socket.MSG_CMSG_CLOEXEC | flags)
            except BlockingIOError:
                await self._readable(sock)
                continue
            except OSError:
                return b"", [], False
            return data, _wire.rights_in(ancillary), bool(got & (socket.MSG_TRUNC | socket.MSG_CTRUNC))

    async def _send(self, sock, data: bytes, memories=()) -> None:
        while True:
            try:
                if memories:
                    socket.send_fds(sock, [data], list(memories), socket.MSG_NOSIGNAL)
                else:
                    sock.send(data, socket.MSG_NOSIGNAL)
                return
            except BlockingIOError:
                await asyncio.sleep(0.002)
            except OSError:
                return  # it has gone

    async def _serve_client(self, service):
        with service:
            data, descriptors, is_cut = await self._receive(service)
            try:
                if len(data) < 24:
                    return
                bits, _, port, _, _, message_id = _wire.HEADER.unpack_from(data)
                code = self._check_in_code(data, descriptors, is_cut, message_id)
                how = ""
                for each in self._check_ins if not code else ():
                    if each[2] is None or each[2] > 0:
                        if each[2] is not None:
                            each[2] -= 1
                        how, code = each[0], each[1]
                        break
                if how == "close":
                    self._tell("CheckIn", {}, "close")
                    return
                if code:
                    self._tell("CheckIn", {}, f"fail {code}")
                    await self._send(service, _wire.status_reply(message_id, port, code))
                    return
                upstream = None
                if self._upstream is not None:
                    upstream = Client(self._upstream)
                    try:
                        await asyncio.get_running_loop().run_in_executor(None, upstream.connect)
                    except HelperError as error:
                        self._complain(error)
                        await self._send(service, _wire.status_reply(message_id, port, error.code))
                        return
                    except Error as error:
                        self._complain(error)
                        return
                ours, theirs = socket.socketpair(socket.AF_UNIX, socket.SOCK_SEQPACKET)
                ours.setblocking(False)
                reply = _wire.HEADER.pack(_wire.COMPLEX_BITS, CHECK_IN.request_size, 0, port, 0, CHECK_IN.id + REPLY_ID)
                reply += (1).to_bytes(4, "little") + _wire.PORT_DESCRIPTOR.pack(0, 0, 0, CHECK_IN_REPLY_DISPOSITION, PORT)
                with theirs:
                    await self._send(service, reply, [theirs.fileno()])
                self._begin(self._serve_channel(ours, socket.socket(fileno=descriptors.pop()), upstream))
            finally:
                _wire.close_all(descriptors)

    @staticmethod
    def _check_in_code(data, descriptors, is_cut, message_id) -> int:
        if message_id != CHECK_IN.id:
            return BAD_ID
        if is_cut or len(data) != CHECK_IN.request_size or len(descriptors) != 1 or not _wire.is_channel(descriptors[0]):
            return BAD_ARGUMENTS
        _, _, _, disposition, kind = _wire.PORT_DESCRIPTOR.unpack_from(data, 28)
        return 0 if (disposition, kind) == (CHECK_IN_DISPOSITION, PORT) else TYPE_ERROR

    async def _serve_channel(self, channel, death_watch, upstream):
        try:
            with channel, death_watch:
                while await self._serve_request(channel, upstream):
                    pass
        finally:
            if upstream is not None:
                upstream.close()

    async def _serve_request(self, channel, upstream) -> bool:
        # Looked at before it is taken, so that a script can leave it unread.
        data, descriptors, is_cut = await self._receive(channel, socket.MSG_PEEK)
        try:
            if not data:
                return False
            request = Request(data, descriptors, is_cut) if len(data) >= 24 else None
        finally:
            _wire.close_all(descriptors)
        if request is None or request.code:
            await self._take(channel)
            if request is not None and request.port:
                name = request.routine.name if request.routine is not None else str(request.id)
                self._tell(name, {}, f"fail {request.code}")
                await self._send(channel, _wire.status_reply(request.id, request.port, request.code))
            return True
        routine = request.routine
        assert routine is not None
        self.requests.append((routine.name, request.arguments))
        if upstream is not None:
            rule = await self._ask(upstream, routine, request.arguments)
        else:
            rule = self.script.rule_for(routine, request.arguments) or self._unscripted(routine)
        outcome = rule.outcome + (f" {rule.value}" if rule.outcome == "fail" else "")
        self._tell(routine.name, request.arguments, outcome)
        if rule.outcome == "unread":
            return False
        await self._take(channel)
        for each in rule.pushes:
            self._begin(self._push(each))
        if rule.delay:
            await asyncio.sleep(rule.delay)
        return await self._carry_out(channel, request, rule)

    async def _take(self, channel):
        _, descriptors, _ = await self._receive(channel)
        _wire.close_all(descriptors)

    async def _carry_out(self, channel, request: Request, rule: Rule) -> bool:
        if rule.outcome == "close":
            return False
        if rule.outcome == "silence" or not request.port:
            return True
        if rule.outcome == "send":
            await self._send(channel, rule.value)
            return True
        memories: list[int] = []
        if rule.outcome == "fail":
            reply = _wire.status_reply(request.id, request.port, rule.value)
        else:
            assert request.routine is not None
            value = rule.value if rule.routine is not None else default_value(request.routine)
            reply, memories = answer_to(request, value, rule.in_memory)
        try:
            if rule.cut is not None:
                await self._send(channel, reply[:rule.cut])
                return False
            await self._send(channel, reply, memories)
        finally:
            _wire.close_all(memories)
        return True

    def _unscripted(self, routine: Routine) -> Rule:
        self.unscripted.append(routine.name)
        rule = Rule(0, routine)
        rule.outcome, rule.value = "fail", NOT_SCRIPTED
        return rule

    async def _ask(self, upstream: Client, routine: Routine, arguments: dict) -> Rule:
        """What the real helper does, as a rule."""
        rule = Rule(0, routine)
        rule.outcome = "answer"
        entry = self._recorder.begin(routine, arguments) if self._recorder is not None else None
        try:
            rule.value = await asyncio.get_running_loop().run_in_executor(
                None, lambda: upstream.call(routine.name, **arguments))
        except HelperError as error:
            rule.outcome, rule.value = "fail", error.code
        except Error:
            rule.outcome = "close"
        if entry is not None:
            self._recorder.finish(entry, routine, rule)
        return rule

    def _tell(self, name: str, arguments: dict, outcome: str):
        if self._log is not None:
            self._log(name, arguments, outcome)

    # ---- pushes ----

    async def _push(self, push: Push):
        if push.delay:
            await asyncio.sleep(push.delay)
        outcome = await asyncio.get_running_loop().run_in_executor(None, self.push, push)
        self._tell("push" if push.name else "notify", push.values, outcome)

    def push(self, push: Push) -> str:
        """Sends a push or a notification to whoever listens in the folder; says in a word what became of it."""
        service = PUSH_SERVICE if push.name else NOTIFICATION_SERVICE
        with socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET) as sock:
            sock.settimeout(_PUSH_TIME)
            end = monotonic() + _PUSH_TIME
            try:
                sock.connect(os.path.join(self.directory, service))
                if push.name is None:
                    sock.send(_wire.HEADER.pack(0, 24, 0, 0, 0, 0) + plistlib.dumps(push.values, fmt=plistlib.FMT_BINARY))
                    return "sent"
                region = plistlib.dumps({PUSH_CLIENT_KEY: ["BrenvikMobileHelper"], **push.values}, fmt=plistlib.FMT_BINARY)
                body, memories = _wire.with_regions(PUSH_SIZE, NDR, [region])
                header = _wire.HEADER.pack(_wire.COMPLEX_BITS, PUSH_SIZE, 1, 0, 0, _PUSH_IDS[push.name])
                try:
                    socket.send_fds(sock, [header + body], memories, socket.MSG_NOSIGNAL)
                finally:
                    _wire.close_all(memories)
                sock.settimeout(max(end - monotonic(), 0.001))
                reply = sock.recv(LARGEST)
            except TimeoutError:
                return "not answered in time"
            except OSError as error:
                return f"not delivered: {error.strerror}"
        code = int.from_bytes(reply[32:36], "little", signed=True) if len(reply) >= 36 else None
        return "no answer" if code is None else f"answered {code}"

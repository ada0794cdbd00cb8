# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The program brenvik-mobile-helper-mock."""
import argparse
import asyncio
import contextlib
import json
import os
import signal
import sys

from .._build import BOOTSTRAP_DIRECTORY, VERSION
from .._client import service_socket
from .._errors import Error
from .._listener import Listener
from .._table import ROUTINES
from . import _private
from ._record import Recorder, json_of
from ._script import Script, ScriptError, parse
from ._server import Mock

NAME = "brenvik-mobile-helper-mock"
DONE, FAILED, USAGE = 0, 1, 2


class _Usage(Exception):
    pass


class _Parser(argparse.ArgumentParser):
    def error(self, message):
        raise _Usage(message)


def make_parser() -> argparse.ArgumentParser:
    parser = _Parser(
        prog=NAME, allow_abbrev=False, add_help=False, usage=f"{NAME} [OPTION...] [SCRIPT] [-- COMMAND [ARGUMENT...]]",
        description="Stands in for BrenvikMobileHelper: serves its protocol as a script says, without root.",
        epilog="With COMMAND, the command finds the mock where the helper is looked for, and its exit status is this program's. "
        "Exit status: 0 done; 1 failed, or --strict was not met; 2 wrong usage, or a mistake in the script.")
    parser.add_argument("script", nargs="?", metavar="SCRIPT", help="what to answer; - reads standard input; without: nothing")
    parser.add_argument("--directory", metavar="DIRECTORY",
                        help="folder for the sockets, made when missing; default with COMMAND: one of its own")
    parser.add_argument("--check", action="store_true", help="read the script, tell its first mistake, and leave")
    parser.add_argument("--strict", action="store_true",
                        help="fail at the end when a request had no rule, or a rule no request")
    parser.add_argument("--log", metavar="FILE", help="where to write a line for each request, - for standard output; "
                        "default: standard output, with COMMAND nowhere")
    parser.add_argument("--json", action="store_true", help="write each of those lines as a JSON object")
    parser.add_argument("--record", metavar="FILE", help="ask the real helper, and write what it answers as a script")
    parser.add_argument("--upstream", metavar="SOCKET", help=f"the real helper's socket; default: {service_socket()}")
    parser.add_argument("--pushes", metavar="DIRECTORY",
                        help="with --record: receive the real helper's pushes in this folder, record them and pass them on")
    parser.add_argument("--version", action="version", version=f"{NAME} {VERSION}", help="print the version and leave")
    parser.add_argument("--help", action="help", help="print this and leave")
    return parser


def _line(name: str, arguments: dict, outcome: str, as_json: bool) -> str:
    readable = {}
    for key, value in arguments.items():
        if isinstance(value, bytes):
            form = json_of(value or None)
            value = json.loads(form) if form else f"{len(value)} bytes"
        readable[key] = value
    if as_json:
        return json.dumps({"request": name, "arguments": readable, "outcome": outcome})
    return f"{name}{''.join(f' {key}={json.dumps(value, ensure_ascii=False)}' for key, value in readable.items())} -> {outcome}"


def _name_of(script: str | None) -> str:
    return "standard input" if script == "-" else str(script)


def _read_script(path: str | None) -> Script:
    if path is None:
        return Script()
    try:
        if path == "-":
            data = sys.stdin.buffer.read()
        else:
            with open(path, "rb") as file:
                data = file.read()
    except OSError as error:
        raise _Usage(f"{path}: {error.strerror}") from None
    name = _name_of(path)
    try:
        text = data.decode()
    except UnicodeDecodeError as error:
        line = data.count(b"\n", 0, error.start) + 1
        raise _Usage(f"{name}:{line}: not UTF-8") from None
    try:
        return parse(text)
    except ScriptError as error:
        raise _Usage(f"{name}:{error.line}: {error.reason}") from None


class _Program:
    def __init__(self, options, script: Script, command: list[str], log):
        self.options, self.command, self.log = options, command, log
        self.recorder = None
        self.listener = None
        self.complaint = ""
        self.mock = Mock(script, directory=options.directory, log=self._log,
                         upstream=(options.upstream or service_socket()) if options.record else None)
        self.mock._complain = self._complain
        try:
            if options.record:
                self.recorder = self.mock._recorder = Recorder(options.record)
            if options.pushes:
                self.listener = Listener(options.pushes)
        except BaseException:
            self.close()
            raise

    def close(self):
        if self.listener is not None:
            self.listener.close()
        if self.recorder is not None:
            self.recorder.close()
        self.mock.close()

    def _log(self, name, arguments, outcome):
        if self.log is not None:
            print(_line(name, arguments, outcome, self.options.json), file=self.log, flush=True)

    def _complain(self, error):
        """A client tries a few times; the same is told once."""
        if str(error) != self.complaint:
            self.complaint = str(error)
            print(f"{NAME}: the real helper cannot be asked: {error}", file=sys.stderr, flush=True)

    def _pass_on(self):
        event = self.listener.next(0)
        if event is None:
            return
        self.recorder.add_event(event)
        from ._script import Push
        from .._listener import CivicInfo, LocalAddress
        names = {CivicInfo: "SetCivicInfoBasedOnCurrentLocation", LocalAddress: "SetLocalRoutableAddress"}
        self.mock._begin(self.mock._push(Push(names.get(type(event)), event.values)))

    async def run(self) -> int:
        loop = asyncio.get_running_loop()
        serving = loop.create_task(self.mock.serve())
        await asyncio.sleep(0)
        if self.listener is not None:
            loop.add_reader(self.listener.fileno(), self._pass_on)
        try:
            status = await (self._run_command(loop) if self.command else self._wait(loop, serving))
        finally:
            if self.listener is not None:
                loop.remove_reader(self.listener.fileno())
            self.mock.stop()
            await serving
        if self.mock._failure is not None:
            raise self.mock._failure
        return status

    async def _wait(self, loop, serving) -> int:
        for each in (signal.SIGINT, signal.SIGTERM):
            loop.add_signal_handler(each, self.mock.stop)
        print(f"{NAME}: listening at {self.mock.path}", file=sys.stderr, flush=True)
        await asyncio.wait([serving])
        return DONE

    async def _run_command(self, loop) -> int:
        process = await asyncio.create_subprocess_exec(
            sys.executable, "-I", _private.__file__, BOOTSTRAP_DIRECTORY, self.mock.directory, *self.command)

        def pass_on(number):
            with contextlib.suppress(ProcessLookupError):
                process.send_signal(number)

        loop.add_signal_handler(signal.SIGINT, lambda: None)  # a terminal sends it to the command as well
        loop.add_signal_handler(signal.SIGTERM, pass_on, signal.SIGTERM)
        status = await process.wait()
        return status if status >= 0 else 128 - status

    def strictly(self) -> int:
        """Tells what was not as scripted."""
        wrong = [f"a request of {name} had no rule" for name in dict.fromkeys(self.mock.unscripted)]
        name = _name_of(self.options.script)
        wrong += [f"{name}:{each.line}: no request came for this rule" for each in self.mock.script.unused]
        for each in wrong:
            print(f"{NAME}: {each}", file=sys.stderr)
        return FAILED if wrong else DONE


def _offers(word: str) -> int:
    """For the completions, and for a person at a loss: the routines and their arguments."""
    if word != "routines":
        return USAGE
    for each in ROUTINES.values():
        print(each.name, *(f"{argument.name}=" for argument in each.parameters))
    return DONE


def _main(arguments: list[str]) -> int:
    command: list[str] = []
    if "--" in arguments:
        at = arguments.index("--")
        arguments, command = arguments[:at], arguments[at + 1:]
        if not command:
            raise _Usage("a command must stand behind --")
    if arguments[:1] == ["__complete"]:
        return _offers("".join(arguments[1:]))
    options = make_parser().parse_args(arguments)
    if options.record and options.script:
        raise _Usage("--record and SCRIPT exclude each other")
    for name in ("upstream", "pushes"):
        if getattr(options, name) and not options.record:
            raise _Usage(f"--{name} needs --record")
    if options.check and (options.record or command or not options.script):
        raise _Usage("--check wants a script and nothing else")
    script = _read_script(options.script)
    if options.check:
        return DONE
    if not command and not options.directory:
        raise _Usage("without a command, --directory must say where the sockets go")
    return _run(options, script, command)


def _run(options, script: Script, command: list[str]) -> int:
    log = None if command else sys.stdout
    stack = contextlib.ExitStack()
    try:
        if options.log == "-":
            log = sys.stdout
        elif options.log:
            log = stack.enter_context(open(options.log, "w", encoding="utf-8", errors="backslashreplace"))
        if log is sys.stdout and hasattr(log, "reconfigure"):
            log.reconfigure(errors="backslashreplace")
        program = _Program(options, script, command, log)
        stack.callback(program.close)
        status = asyncio.run(program.run())
        strict = program.strictly() if options.strict else DONE
        return status or strict
    finally:
        stack.close()


def main() -> int:
    try:
        return _main(sys.argv[1:])
    except _Usage as error:
        print(f"{NAME}: {error}", file=sys.stderr)
        return USAGE
    except BrokenPipeError:
        os.dup2(os.open(os.devnull, os.O_WRONLY), 1)  # nobody reads any more
        return FAILED
    except OSError as error:
        what = f"{error.filename}: {error.strerror}" if error.filename and error.strerror else error
        print(f"{NAME}: {what}", file=sys.stderr)
        return FAILED
    except Error as error:
        print(f"{NAME}: {error}", file=sys.stderr)
        return FAILED

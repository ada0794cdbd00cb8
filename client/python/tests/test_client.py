#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The blocking client against helpers that do as they are told, and against a script of broken ones."""
import datetime
import fcntl
import os
import pathlib
import plistlib
import re
import socket
import struct
import subprocess
import sys
import threading
import time
import unittest

import support
import brenvik_mobile_helper as package
from brenvik_mobile_helper import Client, _table, _wire
from fake_helper import FakeHelper, receive, send
import wire  # the other Python client, written from the page alone


class ScriptedHelper:
    """Serves one client after another; each is a function that is given the channel."""

    def __init__(self, path, *scripts):
        self.scripts = list(scripts)
        self.check_ins = 0
        self.errors = []
        self.listening = socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET)
        self.listening.bind(str(path))
        self.listening.listen(8)
        self.thread = threading.Thread(target=self._run, daemon=True)
        self.thread.start()

    def _run(self):
        try:
            for script in self.scripts:
                connection, _ = self.listening.accept()
                with connection:
                    request = receive(connection)
                    self.check_ins += 1
                    if script is None:  # leaves before it answers
                        os.close(request.fds[0])
                        continue
                    ours, theirs = socket.socketpair(socket.AF_UNIX, socket.SOCK_SEQPACKET)
                    reply = request._header(40, 0x80000012) + struct.pack("<IIIHBB", 1, 0, 0, 0, 19, 0)
                    send(connection, (reply, [theirs.detach()]))
                with ours:
                    script(ours)
                os.close(request.fds[0])
        except OSError as error:
            self.errors.append(error)

    def __enter__(self):
        return self

    def __exit__(self, *_):
        self.thread.join(30)
        self.listening.close()
        if self.thread.is_alive() or self.errors:
            raise AssertionError(f"the script did not end: {self.errors}")


def until_the_end(channel, answer=lambda request: request.status(0)):
    while (request := receive(channel)) is not None:
        send(channel, answer(request))


class Table(unittest.TestCase):
    def test_it_agrees_with_a_client_that_was_written_from_the_page(self):
        forms = {"string256": "text 256", "string64": "text 64", "integer": "boolean"}
        self.assertEqual([(each.name, each.request_size, each.reply) for each in _table.ROUTINES.values()],
                         [(name, size, forms.get(form, form)) for name, size, form in wire.ROUTINES])
        self.assertEqual({name: each.id for name, each in _table.ROUTINES.items()}, wire.ID)

    def test_codes_are_those_of_the_c_library(self):
        header = (support.SOURCE / "client/include/brenvik/mobile_helper.h").read_text()
        in_c = {name.replace("_", ""): int(code) for name, code in re.findall(r"BVMH_ERROR_(\w+) = (-\d+)", header)}
        classes = [each for each in vars(package).values() if isinstance(each, type) and issubclass(each, package.TransportError)]
        ours = {each.__name__.removesuffix("Error").upper(): each.code for each in classes if each is not package.TransportError}
        import brenvik_mobile_helper._listener  # noqa: F401
        self.assertEqual(ours, {name: in_c[name] for name in ours})
        self.assertGreaterEqual(len(ours), 11)
        texts = (support.SOURCE / "client/ErrorText.cpp").read_text()
        for code in ours.values():
            self.assertIn(f'"{package.error_text(code)}"', texts)


class Calls(support.InFolder):
    def one_call(self, work, answer):
        """The one request that work(client) sends, and its result."""
        with FakeHelper(self.path, answer) as helper, Client(self.path) as client:
            result = work(client)
        self.path.unlink()
        request, = helper.requests
        return request, result

    def test_every_routine_sends_its_arguments_where_they_belong(self):
        for routine in _table.ROUTINES.values():
            values, expected = {}, {}
            for number, each in enumerate(routine.parameters):
                values[each.name] = {"text": f"text-{number}-ü", "i32": -5 - number, "f64": 1.5 + number,
                                     "region": [f"region-{number}"]}[each.type]

            def answer(request):
                if routine.reply == "region":
                    return request.payload(plistlib.dumps({"a": 1}))
                if routine.reply == "boolean":
                    return request.boolean(1)
                if routine.reply.startswith("text"):
                    return request.string("grüße", int(routine.reply[5:]))
                return request.status(0)

            name = re.sub(r"(?<=[a-z])(?=[A-Z])|(?<=[A-Z])(?=[A-Z][a-z])", "_", routine.name).lower()
            given = {each + "_" * (each in ("from",)): value for each, value in values.items()}
            request, result = self.one_call(lambda client: getattr(client, name)(**given), answer)
            self.assertEqual(request.id, routine.id)
            self.assertEqual(result, {"status": None, "boolean": True, "region": {"a": 1}}.get(routine.reply, "grüße"), name)
            bits, size, port, _, _, _ = struct.unpack_from("<IIIIIi", request.data)
            self.assertEqual((bits, size), (0x80000012 if routine.descriptors else 18, routine.request_size))
            self.assertNotEqual(port, 0)
            if routine.arguments:
                at = 28 + 16 * routine.descriptors if routine.descriptors else 24
                self.assertEqual(request.data[at:at + 8], wire.NDR)
            for each in routine.parameters:
                value = values[each.name]
                if each.type == "text":
                    self.assertEqual(request.data[each.offset:each.offset + each.size], value.encode().ljust(each.size, b"\0"))
                elif each.type == "i32":
                    self.assertEqual(request.integer(each.offset), value)
                elif each.type == "f64":
                    self.assertEqual(request.double(each.offset), value)
                else:
                    region = request.region(each.offset)
                    self.assertEqual(plistlib.loads(region), value)
                    length, = [other for other in routine.arguments if other.region == each.name]
                    self.assertEqual(struct.unpack_from("<I", request.data, length.offset)[0], len(region))

    def test_values_of_every_kind_go_there_and_back(self):
        value = {"text": "grün", "number": -3, "real": 0.5, "yes": True, "data": b"\0\1", "list": ["a", 1],
                 "date": datetime.datetime(2026, 1, 2, 3, 4, 5)}
        stored = []

        def answer(request):
            if request.id == 8683555:
                stored.append(plistlib.loads(request.region()))
                return request.status(0)
            return request.payload(plistlib.dumps(stored[-1]), in_line=False)

        with FakeHelper(self.path, answer), Client(self.path) as client:
            client.set_preference_value("domain", "key", value)
            self.assertEqual(client.copy_preference_value("domain", "key"), value)

    def test_none_removes_a_preference_and_stands_for_no_value(self):
        request, _ = self.one_call(lambda client: client.set_preference_value("d", "k", None), None)
        self.assertEqual(len(request.region()), 1)
        _, result = self.one_call(lambda client: client.copy_preference_value("d", "k"), lambda request: request.payload(b""))
        self.assertIsNone(result)

    def test_regions_that_do_not_fit_the_datagram_travel_in_sealed_memory(self):
        for size in (64_900, 64_960, 64_968, 64_969, 70_000, 3_000_000):
            value = b"x" * size
            seen = []

            def answer(request):
                address, = struct.unpack_from("<Q", request.data, 28)
                seen.append((address != 0, request.region() == value))
                if not address:
                    seals = fcntl.fcntl(request.fds[0], fcntl.F_GET_SEALS)
                    seen.append(seals & 0xE == 0xE)
                    os.close(request.fds[0])
                return request.status(0)

            with FakeHelper(self.path, answer), Client(self.path) as client:
                client.call("SetPreferenceValue", domain="d", key="k", value=value)
            self.path.unlink()
            self.assertEqual(seen, [(True, True)] if 568 + size <= 65536 else [(False, True), True], size)

    def test_two_large_regions_travel_both(self):
        seen = []

        def answer(request):
            first, _, _, _, _, length = struct.unpack_from("<QBBBBI", request.data, 28)
            second, _, _, _, _, other = struct.unpack_from("<QBBBBI", request.data, 44)
            memories = list(request.fds)
            for address, size in ((first, length), (second, other)):
                in_line = address or not size
                seen.append(request.data[address:address + size] if in_line else os.pread(memories.pop(0), size, 0))
            for each in request.fds:
                os.close(each)
            return request.payload(plistlib.dumps([]))

        for labels, languages in ((b"l" * 40_000, b"m" * 40_000), (b"l" * 70_000, b"m" * 5), (b"l" * 5, b"m" * 70_000),
                                  (b"l" * 70_000, b"m" * 70_000), (b"", b"m")):
            seen.clear()
            with FakeHelper(self.path, answer), Client(self.path) as client:
                client.call("CopyBadgeLabels", labels=labels, languages=languages)
            self.path.unlink()
            self.assertEqual(seen, [labels, languages])

    def test_a_text_that_does_not_fit_is_told_and_nothing_is_sent(self):
        with FakeHelper(self.path) as helper, Client(self.path) as client:
            client.set_voicemail_token("x" * 255)
            for wrong in ("x" * 256, "ü" * 128, "a\0b", "\udc80", 5, None):
                with self.assertRaises(package.InvalidArgumentError) as caught:
                    client.set_voicemail_token(wrong)
                self.assertIn("token", str(caught.exception))
            for wrong in (1 << 31, -(1 << 31) - 1, "1", 1.5):
                with self.assertRaises(package.InvalidArgumentError):
                    client.cellular_heartbeat(wrong)
            with self.assertRaises(package.InvalidArgumentError):
                client.request_country_code_from_location("north", 0)
            for wrong in ({1: 2}, object(), [None], 1 << 70):
                with self.assertRaises(package.InvalidArgumentError):
                    client.set_preference_value("d", "k", wrong)
            deep = []
            for _ in range(100_000):
                deep = [deep]
            with self.assertRaises(package.InvalidArgumentError):
                client.set_preference_value("d", "k", deep)
            with self.assertRaises(package.InvalidArgumentError):
                client.call("NoSuchRoutine")
            with self.assertRaises(package.InvalidArgumentError):
                client.call("CopyCountryCode", surprise=1)
            with self.assertRaises(package.InvalidArgumentError):
                client.call("SetVoicemailToken")
            with self.assertRaises(package.InvalidArgumentError):
                client.call("SetPreferenceValue", domain="d", key="k", value="text")
        self.assertEqual(len(helper.requests), 1)

    def test_paths_may_be_path_objects(self):
        request, result = self.one_call(lambda client: client.copy_crash_logs(pathlib.Path("/var/crash")),
                                        lambda request: request.boolean(0))
        self.assertEqual((request.text(32, 256), result), ("/var/crash", False))

    def test_codes_become_exceptions_with_the_code(self):
        for code, kind in ((5, package.HelperError), (8, package.NoAccessError), (35, package.RefusedError),
                           (-304, package.HelperError), (1234, package.HelperError)):
            with FakeHelper(self.path, lambda request: request.status(code)), Client(self.path) as client:
                with self.assertRaises(kind) as caught:
                    client.copy_country_code()
                self.assertEqual(caught.exception.code, code)
                self.assertIn(str(code), str(caught.exception))
            self.path.unlink()

    def test_ping_takes_the_answer_of_an_unknown_id_for_yes(self):
        with FakeHelper(self.path, lambda request: request.status(-303)) as helper:
            client = Client(self.path)
            client.ping()
            client.close()
        self.assertEqual(helper.requests[0].id, 0)

    def test_threads_may_share_a_client(self):
        def answer(request):
            return request.string(request.text(32, 256), 256)

        wrong = []

        def work(client, number):
            for _ in range(200):
                if client.copy_voicemail_token_for_key(str(number)) != str(number):
                    wrong.append(number)

        with FakeHelper(self.path, answer), Client(self.path) as client:
            threads = [threading.Thread(target=work, args=(client, number)) for number in range(4)]
            for each in threads:
                each.start()
            for each in threads:
                each.join()
        self.assertEqual(wrong, [])


class Failures(support.InFolder):
    def test_no_helper(self):
        with self.assertRaises(package.UnreachableError) as caught:
            Client(self.path).connect()
        self.assertIsInstance(caught.exception.__cause__, FileNotFoundError)
        self.path.touch()
        with self.assertRaises(package.UnreachableError):
            Client(self.path).copy_country_code()

    def test_a_path_that_is_none(self):
        for wrong in ("", "x" * 108, "a\0b"):
            with self.assertRaises(package.InvalidArgumentError):
                Client(wrong)
        for wrong in (0, -1, float("nan"), "soon", 1e10):
            with self.assertRaises(package.InvalidArgumentError):
                Client(self.path, timeout=wrong)

    def test_a_refusal(self):
        with FakeHelper(self.path, refusal=35), self.assertRaises(package.RefusedError) as caught:
            Client(self.path).connect()
        self.assertEqual(caught.exception.code, 35)

    @unittest.skipUnless(os.geteuid() == 0, "needs root to become somebody else")
    def test_an_account_outside_the_group_is_refused_by_the_kernel(self):
        self.folder.chmod(0o755)
        with FakeHelper(self.path):
            self.path.chmod(0o660)
            child = os.fork()
            if child == 0:
                try:
                    os.setresgid(65534, 65534, 65534)
                    os.setresuid(65534, 65534, 65534)
                    Client(self.path).connect()
                except package.RefusedError as error:
                    os._exit(0 if isinstance(error.__cause__, PermissionError) and error.code == 35 else 2)
                finally:
                    os._exit(1)
            self.assertEqual(os.waitstatus_to_exitcode(os.waitpid(child, 0)[1]), 0)

    def test_a_closed_client_says_so_and_can_be_opened_again(self):
        with FakeHelper(self.path, lambda request: request.string("NO", 64)):
            client = Client(self.path)
            self.assertEqual(client.copy_country_code(), "NO")
            client.close()
            with self.assertRaises(package.NotConnectedError):
                client.copy_country_code()
            client.connect()
            self.assertEqual(client.copy_country_code(), "NO")
            client.close()

    def test_a_helper_that_left_meanwhile_is_asked_again(self):
        with ScriptedHelper(self.path, lambda channel: None, until_the_end) as helper:
            client = Client(self.path)
            client.connect()
            client.clear_voicemail_token()
            client.close()
        self.assertEqual(helper.check_ins, 2)

    def test_a_helper_that_left_the_request_unread_is_asked_again(self):
        def leaves(channel):
            select_readable(channel)

        with ScriptedHelper(self.path, leaves, until_the_end) as helper:
            client = Client(self.path)
            client.connect()
            client.clear_voicemail_token()
            client.close()
        self.assertEqual(helper.check_ins, 2)

    def test_a_request_that_may_have_been_carried_out_is_not_sent_twice(self):
        requests = []

        def reads_and_leaves(channel):
            requests.append(receive(channel))

        with ScriptedHelper(self.path, reads_and_leaves, until_the_end) as helper:
            client = Client(self.path)
            client.connect()
            with self.assertRaises(package.AnswerLostError):
                client.clear_voicemail_token()
            self.assertEqual((len(requests), helper.check_ins), (1, 1))
            client.clear_voicemail_token()  # and the client is usable
            client.close()

    def test_a_helper_that_always_leaves_is_given_up(self):
        with ScriptedHelper(self.path, None, None, None, until_the_end) as helper:
            client = Client(self.path)
            client.connect()
            client.close()
        self.assertEqual(helper.check_ins, 4)

    def test_a_late_answer_is_not_taken_for_the_next_one(self):
        def script(channel):
            late = receive(channel)
            next_one = receive(channel)
            send(channel, late.string("late", 256))
            send(channel, next_one.string("next", 256))
            until_the_end(channel)

        with ScriptedHelper(self.path, script):
            client = Client(self.path)
            client.connect()
            client.timeout = 0.05
            with self.assertRaises(package.TimedOutError) as caught:
                client.copy_voicemail_token()
            self.assertIsInstance(caught.exception, TimeoutError)
            client.timeout = None
            self.assertEqual(client.copy_voicemail_token_for_key("k"), "next")
            client.close()

    def test_signals_do_not_make_the_time_out_longer(self):
        import signal

        def script(channel):
            receive(channel)
            receive(channel)

        with ScriptedHelper(self.path, script):
            client = Client(self.path)
            client.connect()
            client.timeout = 0.3
            before = signal.signal(signal.SIGALRM, lambda *_: None)
            signal.setitimer(signal.ITIMER_REAL, 0.02, 0.02)
            try:
                with self.assertRaises(package.TimedOutError):
                    client.copy_voicemail_token()
            finally:
                signal.setitimer(signal.ITIMER_REAL, 0)
                signal.signal(signal.SIGALRM, before)
                client.close()

    def test_an_exception_of_a_signal_handler_leaves_the_client_usable(self):
        import signal

        def script(channel):
            late = receive(channel)
            os.kill(os.getpid(), signal.SIGUSR1)
            next_one = receive(channel)
            send(channel, late.string("late", 256))
            send(channel, next_one.string("next", 256))
            until_the_end(channel)

        class Interrupted(Exception):
            pass

        def handler(*_):
            raise Interrupted

        before = signal.signal(signal.SIGUSR1, handler)
        try:
            with ScriptedHelper(self.path, script):
                client = Client(self.path)
                client.connect()
                with self.assertRaises(Interrupted):
                    client.copy_voicemail_token()
                self.assertEqual(client.copy_voicemail_token(), "next")
                client.close()
        finally:
            signal.signal(signal.SIGUSR1, before)

    def test_an_answer_to_something_else_ends_the_channel_and_the_next_call_opens_another(self):
        def lies(channel):
            request = receive(channel)
            request.reply_port += 1
            send(channel, request.status(0))
            receive(channel)

        with ScriptedHelper(self.path, lies, until_the_end) as helper:
            client = Client(self.path)
            with self.assertRaises(package.ProtocolError):
                client.clear_voicemail_token()
            client.clear_voicemail_token()
            client.close()
        self.assertEqual(helper.check_ins, 2)

    def test_no_descriptor_is_lost(self):
        def with_memory(request):
            memory = os.memfd_create("gift")
            return request.status(0), [memory]

        def work():
            with FakeHelper(self.path, with_memory), Client(self.path) as client:
                for _ in range(3):
                    with self.assertRaises(package.ProtocolError):
                        client.clear_voicemail_token()
            self.path.unlink()
            with FakeHelper(self.path, lambda request: request.payload(plistlib.dumps("x" * 100), in_line=False)):
                with Client(self.path) as client:
                    self.assertEqual(client.copy_preference_value("d", "k"), "x" * 100)
            self.path.unlink()
            with FakeHelper(self.path, refusal=35), self.assertRaises(package.RefusedError):
                Client(self.path).connect()
            self.path.unlink()

        def settled():
            work()
            end = time.monotonic() + 20  # the threads of the fake helper close what is theirs
            while threading.active_count() > 1 and time.monotonic() < end:
                time.sleep(0.001)

        self.expect_no_descriptor_lost(settled)


def select_readable(sock):
    import select
    select.select([sock], [], [], 20)


class Replies(unittest.TestCase):
    """What is believed of a reply: every shorter length, every flipped bit, every wrong form."""

    ROUTINES = {"status": "ClearVoicemailToken", "boolean": "CopyCrashLogs", "text 64": "CopyCountryCode",
                "text 256": "CopyVoicemailToken", "region": "CopyPreferenceValue"}

    def reply_of(self, form, in_line=True):
        routine = _table.ROUTINES[self.ROUTINES[form]]
        from fake_helper import Request
        request = Request(struct.pack("<IIIIIi", 18, 24, 9, 0, 0, routine.id), [])
        if form == "region":
            made = request.payload(plistlib.dumps({"key": "value"}), in_line)
            return routine, *(made if isinstance(made, tuple) else (made, []))
        data = {"status": request.status(0), "boolean": request.boolean(1)}.get(form) or request.string("abc", int(form[5:]))
        return routine, data, []

    def read(self, routine, data, fds, is_cut=False):
        """What came of it; anything but these three fails the test."""
        try:
            return "value", _wire.read_reply(routine, data, fds, is_cut)
        except package.ProtocolError:
            return "protocol", None
        except package.HelperError as error:
            return "code", error.code

    def test_good_ones(self):
        for form in self.ROUTINES:
            routine, data, _ = self.reply_of(form)
            kind, value = self.read(routine, data, [])
            self.assertEqual(kind, "value", form)
            expected = {"status": None, "boolean": True}.get(form, "abc")
            self.assertEqual(plistlib.loads(value) if form == "region" else value,
                             {"key": "value"} if form == "region" else expected)

    def test_every_shorter_length_and_one_byte_more(self):
        for form in self.ROUTINES:
            routine, data, _ = self.reply_of(form)
            for length in [*range(len(data)), len(data) + 1]:
                self.assertEqual(self.read(routine, (data + b"\0")[:length], [])[0], "protocol", (form, length))

    def test_every_flipped_bit(self):
        for form in self.ROUTINES:
            routine, data, _ = self.reply_of(form)
            fixed = {"status": 36, "boolean": 36, "region": 56}.get(form, 36)
            for bit in range(len(data) * 8):
                spoilt = bytearray(data)
                spoilt[bit // 8] ^= 1 << bit % 8
                kind, _ = self.read(routine, bytes(spoilt), [])
                byte = bit // 8
                if bit == 31 or 8 <= byte < 12 or 20 <= byte < 24:  # complex flag, reply port, id
                    self.assertEqual(kind, "protocol", (form, bit))
                elif form != "region" and 32 <= byte < 36:
                    self.assertIn(kind, ("protocol",) if form != "status" else ("protocol", "code"), (form, bit))
                elif form == "region" and (24 <= byte < 36 or byte == 39 or 40 <= byte < 44 or 52 <= byte < 56):
                    self.assertEqual(kind, "protocol", (form, bit))  # count, address, kind, the two sizes
                elif byte >= fixed:
                    self.assertEqual(kind, "value", (form, bit))

    def test_forms_of_other_routines(self):
        for form in self.ROUTINES:
            for other in self.ROUTINES:
                routine, _, _ = self.reply_of(form)
                _, data, _ = self.reply_of(other)
                data = data[:20] + struct.pack("<i", routine.id + 100) + data[24:]
                kind, _ = self.read(routine, data, [])
                self.assertEqual(kind, "value" if form == other else "protocol", (form, other))

    def test_codes_of_the_transport_itself_are_not_believed(self):
        routine, data, _ = self.reply_of("status")
        for code, kind in ((-7100, "code"), (-7099, "protocol"), (-7001, "protocol"), (-7000, "code"), (5, "code")):
            self.assertEqual(self.read(routine, data[:32] + struct.pack("<i", code), [])[0], kind)

    def test_sealed_memory_is_looked_at_before_it_is_read(self):
        routine, data, fds = self.reply_of("region", in_line=False)
        self.assertEqual(self.read(routine, data, fds)[0], "value")
        self.assertEqual(self.read(routine, data, [])[0], "protocol")
        self.assertEqual(self.read(routine, data, fds * 2)[0], "protocol")
        self.assertEqual(self.read(routine, data, fds, is_cut=True)[0], "protocol")
        in_line, in_line_data, _ = self.reply_of("region")
        self.assertEqual(self.read(in_line, in_line_data, fds)[0], "protocol")
        size, = struct.unpack_from("<I", data, 40)
        for seals, length, expected in ((0xE, size, "value"), (0xE, size - 1, "protocol"), (0x6, size, "protocol"),
                                        (0xA, size, "protocol"), (0xC, size, "protocol"), (0, size, "protocol")):
            memory = os.memfd_create("region", os.MFD_ALLOW_SEALING)
            os.write(memory, b"x" * length)
            if seals:
                fcntl.fcntl(memory, fcntl.F_ADD_SEALS, seals)
            self.assertEqual(self.read(routine, data, [memory])[0], expected, (seals, length))
            os.close(memory)
        with open("/dev/null", "rb") as null:
            self.assertEqual(self.read(routine, data, [null.fileno()])[0], "protocol")
        os.close(fds[0])

    def test_a_check_in_must_bring_a_channel(self):
        from fake_helper import Request
        request = Request(_wire.check_in_message(1), [])
        reply = request._header(40, 0x80000012) + struct.pack("<IIIHBB", 1, 0, 0, 0, 19, 0)
        pair = socket.socketpair(socket.AF_UNIX, socket.SOCK_SEQPACKET)
        stream = socket.socketpair()
        with pair[0], pair[1], stream[0], stream[1]:
            good = [pair[0].fileno()]
            self.assertEqual(self.read(_table.CHECK_IN, reply, good)[0], "value")
            for data, fds in ((reply, []), (reply, good * 2), (reply, [stream[0].fileno()]), (reply[:39], good),
                              (reply + b"\0", good), (reply[:38] + b"\x11\0", good), (reply[:39] + b"\1", good),
                              (reply[:24] + b"\2" + reply[25:], good), (request.status(0), [])):
                self.assertEqual(self.read(_table.CHECK_IN, data, fds)[0], "protocol")
            self.assertEqual(self.read(_table.CHECK_IN, request.status(35), []), ("code", 35))

    def test_a_region_that_is_no_property_list(self):
        for bytes_ in (b"", b"x", b"<plist>", b"bplist00", plistlib.dumps({"a": 1})[:-9], b"\xff" * 40,
                       b'<?xml version="1.0"?><!DOCTYPE a [<!ENTITY e "f">]><plist><string>&e;</string></plist>'):
            with self.assertRaises(package.ProtocolError):
                _wire.parsed(bytes_)


class Cost(unittest.TestCase):
    def test_importing_it_brings_neither_asyncio_nor_property_lists(self):
        code = "import sys, brenvik_mobile_helper; print(*[name for name in ('asyncio', 'plistlib', 'typing') if name in sys.modules])"
        environment = {**os.environ, "PYTHONPATH": str(support.BUILD / "python")}
        done = subprocess.run([sys.executable, "-S", "-c", code], capture_output=True, text=True, check=True, env=environment)
        self.assertEqual(done.stdout.strip(), "")

    def test_its_types_hold(self):
        try:
            import mypy  # noqa: F401
        except ImportError:
            self.skipTest("mypy is not installed")
        environment = {**os.environ, "MYPYPATH": str(support.BUILD / "python")}
        done = subprocess.run([sys.executable, "-m", "mypy", "--no-incremental", "-p", "brenvik_mobile_helper"],
                              capture_output=True, text=True, env=environment, cwd="/")
        self.assertEqual(done.returncode, 0, done.stdout)


if __name__ == "__main__":
    unittest.main()

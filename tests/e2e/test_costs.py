# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""What a start and a request cost the real process: system calls, files it looks at and memory from the heap."""
import pathlib
import re
import signal
import struct
import unittest
import unittest.mock

import allocations
import harness
import tracing
import wire
from harness import Daemon, HelperTest, eventually, main, stop_process

CALLS = 50

# A request and the size of its reply. The routines themselves touch neither disk nor heap: a token that is no text,
# and a question whose answer is known after the first time.
IN_LINE = {
    "288 bytes in, 36 out": (wire.simple("SetVoicemailToken", wire.field(b"\xff", 256)), 36),
    "24 bytes in, 40 out": (wire.simple("IsVoicemailServiceSubscribed"), 40),
    "refused for its size": (wire.simple("SetVoicemailToken", wire.field(b"", 255)), 36),
    "of unknown id": (wire.header(1, 24), 36),
}


@unittest.skipUnless(allocations.AVAILABLE, "a sanitizer has costs of its own")
class Costs(HelperTest):
    def setUp(self):
        super().setUp()
        self.caller = self.client()

    def call(self, message, size):
        reply, fds = self.caller.channel.exchange(message)
        self.assertEqual((len(reply), fds), (size, []))

    def calls_traced(self, work):
        """The system calls of the process while work() runs, from one wait to the next."""
        text = tracing.traced(self, self.daemon.pid, work)
        # Without waits that a signal broke off, as when the machine's processes are stopped for a while, and without
        # looks at the clock, which some machines make system calls of.
        return [name for name, rest in re.findall(r"^\d+ +(\w+)\((.*)", text, re.M)
                if "EINTR" not in rest and name != "clock_gettime"]

    def test_an_in_line_request_costs_three_system_calls(self):
        for name, (message, size) in IN_LINE.items():
            with self.subTest(name):
                self.call(message, size)

                def work():
                    for _ in range(CALLS):
                        self.call(message, size)
                calls = self.calls_traced(work)
                # It was waiting already when the tracer came, which the tracer may or may not have seen.
                self.assertEqual(calls[calls.index("recvmsg"):], ["recvmsg", "sendto", "epoll_wait"] * CALLS)

    def test_a_request_that_is_not_answered_costs_no_wake_up_of_its_own_while_more_wait(self):
        message = bytearray(IN_LINE["288 bytes in, 36 out"][0])
        struct.pack_into("<I", message, 8, 0)

        def work():
            stop_process(self.daemon.pid)
            for _ in range(8):
                self.caller.channel.send(bytes(message))
            self.daemon.process.send_signal(signal.SIGCONT)
            self.call(*IN_LINE["of unknown id"])
        calls = self.calls_traced(work)
        self.assertEqual(calls.count("recvmsg"), 9)
        self.assertLessEqual(calls.count("epoll_wait"), 5)

    def test_an_in_line_request_takes_nothing_from_the_heap(self):
        self.daemon.stop()
        counter = allocations.Allocations()
        self.addCleanup(counter.close)
        self.daemon = Daemon(environment=counter.environment)
        self.caller = self.client()
        self.assertGreater(counter.made, 0, "the counter counts")
        for name, (message, size) in IN_LINE.items():
            with self.subTest(name):
                self.call(message, size)
                before = counter.made
                for _ in range(CALLS):
                    self.call(message, size)
                self.assertEqual(counter.made, before)
        before = counter.made
        self.caller.copy_preference("com.example.costs", "key")
        self.assertGreater(counter.made, before, "a routine that takes memory is noticed")


# From main() to the first reply. Each is felt by whoever waits for the start; 101 were seen. 24 are about descriptors in
# reserve, and one looks at each folder above the caller's executable, of which there may be some more.
MOST_CALLS_OF_A_START = 108
# What a start may open: what the baseband library is looked for in, and what admission reads.
OPENED_AT_START = re.compile(
    r"/etc/ld\.so\.cache|/proc/\d+/stat|/proc/\d+/loginuid|/proc/\d+|stat|cgroup|"
    r"/etc/brenvik/entitlements\.d|50-test\.plist")


@unittest.skipUnless(allocations.AVAILABLE, "a sanitizer has costs of its own")
class StartCosts(HelperTest):
    def test_a_start_does_what_a_first_check_in_needs_and_no_more(self):
        self.daemon.stop()
        output = pathlib.Path("/tmp/start")
        # -D: the program keeps the process id that the listening socket was promised to.
        arguments = ["-D", "-o", str(output), str(harness.DAEMON)]
        with unittest.mock.patch.object(harness, "DAEMON", "strace"):
            self.daemon = Daemon(activated=True, arguments=arguments)
        self.client()
        # The reply is seen before the tracer has written it.
        eventually(lambda: re.search(r"^sendmsg\(.*SCM_RIGHTS", output.read_text(), re.M), what="the reply")
        whole = output.read_text()
        # The loader's own are before: how many depends on where the C++ library is.
        start = whole[whole.index("rt_sigaction(SIGPIPE"):whole.index("sendmsg(")]
        calls = re.findall(r"^(\w+)\(", start, re.M)
        if "MAP_DROPPABLE" in start:  # what a C library does before it asks for random bytes without a call, from 2.41 on
            for name in ("rt_sigprocmask", "mmap", "mmap", "rt_sigprocmask"):
                calls.remove(name)
        self.assertLessEqual(len(calls), MOST_CALLS_OF_A_START, start)
        for path in re.findall(r'^open(?:at)?\([^"]*"([^"]*)"', start, re.M):
            self.assertIsNotNone(OPENED_AT_START.fullmatch(path), f"a start opens {path}")
        self.assertNotIn("clone", calls, "a start makes no thread and no process")
        self.assertNotIn("brk", calls, "the heap is large enough as it is")
        looks = re.findall(r'"(?:/proc/\d+/)?stat"', start)
        self.assertEqual(len(looks), 2, "for the trailer, and to be sure of the process that is looked at")


if __name__ == "__main__":
    main()

#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The asyncio client: several calls at once, calls that are given up, helpers that leave."""
import asyncio
import os
import plistlib
import threading
import unittest

import support
import brenvik_mobile_helper as package
from brenvik_mobile_helper import AsyncClient
from fake_helper import FakeHelper, receive, send
from test_client import ScriptedHelper, until_the_end


def echo(request):
    return request.string(request.text(32, 256), 256)


class Asynchronous(support.InFolder):
    def test_calls_at_once_get_each_its_answer(self):
        async def work():
            async with AsyncClient(self.path) as client:
                answers = await asyncio.gather(*(client.copy_voicemail_token_for_key(str(n)) for n in range(500)))
            return answers

        with FakeHelper(self.path, echo) as helper:
            self.assertEqual(asyncio.run(work()), [str(n) for n in range(500)])
        self.assertEqual(len(helper.check_ins), 1)

    def test_it_checks_in_with_the_first_calls_once(self):
        async def work():
            client = AsyncClient(self.path)
            await asyncio.gather(*(client.copy_voicemail_token_for_key("k") for _ in range(5)))
            client.close()

        with FakeHelper(self.path, echo) as helper:
            asyncio.run(work())
        self.assertEqual(len(helper.check_ins), 1)

    def test_regions_and_codes(self):
        def answer(request):
            if request.id == 8683555:
                self.assertEqual(len(plistlib.loads(request.region())), 100_000)
                os.close(request.fds[0])
                return request.status(0)
            if request.id == 8683572:
                return request.status(9)
            return request.payload(plistlib.dumps(["a"]), in_line=False)

        async def work():
            async with AsyncClient(self.path) as client:
                await client.set_preference_value("d", "k", "x" * 100_000)
                with self.assertRaises(package.HelperError) as caught:
                    await client.load_plist_file("/etc/none")
                return caught.exception.code, await client.copy_localized_labels(["USER_LABEL_TRAVEL"], ["de"])

        with FakeHelper(self.path, answer):
            self.assertEqual(asyncio.run(work()), (9, ["a"]))

    def test_a_call_out_of_time_and_a_cancelled_one_leave_the_client_usable(self):
        def script(channel):
            late = [receive(channel), receive(channel)]
            following = receive(channel)
            for each in late:
                send(channel, each.string("late", 256))
            send(channel, following.string("next", 256))
            until_the_end(channel)

        async def work():
            async with AsyncClient(self.path) as client:
                client._timeout = 0.05
                with self.assertRaises(package.TimedOutError):
                    await client.copy_voicemail_token()
                client._timeout = 20
                task = asyncio.create_task(client.copy_voicemail_token())
                await asyncio.sleep(0)
                await asyncio.sleep(0)
                task.cancel()
                with self.assertRaises(asyncio.CancelledError):
                    await task
                result = await client.copy_voicemail_token()
                return result, client._pending

        with ScriptedHelper(self.path, script):
            self.assertEqual(asyncio.run(work()), ("next", {}))

    def test_ten_thousand_calls_that_nobody_reads_can_be_given_up(self):
        done = threading.Event()

        def script(channel):
            done.wait(30)

        async def work():
            async with AsyncClient(self.path) as client:
                tasks = [asyncio.create_task(client.clear_voicemail_token()) for _ in range(10_000)]
                await asyncio.sleep(0.05)
                for each in tasks:
                    each.cancel()
                results = await asyncio.gather(*tasks, return_exceptions=True)
                self.assertEqual({type(each) for each in results}, {asyncio.CancelledError})
                client.close()
                done.set()
                await client.connect()
                await client.clear_voicemail_token()

        with ScriptedHelper(self.path, script, until_the_end):
            asyncio.run(work())

    def test_more_calls_than_the_channel_takes_wait_for_room(self):
        def slow(channel):
            while (request := receive(channel)) is not None:
                send(channel, echo(request))

        async def work():
            async with AsyncClient(self.path) as client:
                value = "x" * 60_000
                await asyncio.gather(*(client.set_preference_value("d", str(n), value) for n in range(200)))

        with FakeHelper(self.path):
            asyncio.run(work())

    def test_a_helper_that_left_meanwhile_is_asked_again(self):
        async def work():
            async with AsyncClient(self.path) as client:
                await client.clear_voicemail_token()
                await client.clear_voicemail_token()

        with ScriptedHelper(self.path, lambda channel: None, until_the_end) as helper:
            asyncio.run(work())
        self.assertEqual(helper.check_ins, 2)

    def test_what_may_have_been_carried_out_is_not_sent_twice(self):
        requests = []
        sent = threading.Event()

        def reads_one_and_leaves(channel):
            sent.wait(20)
            requests.append(receive(channel))

        async def work():
            async with AsyncClient(self.path) as client:
                tasks = [asyncio.create_task(each) for each in (
                    client.clear_voicemail_token(), client.reset_voicemail_store(), client.clear_voicemail_token())]
                while len(client._pending) < 3:
                    await asyncio.sleep(0)
                sent.set()
                return await asyncio.gather(*tasks, return_exceptions=True)

        with ScriptedHelper(self.path, reads_one_and_leaves, until_the_end):
            first, second, third = asyncio.run(work())
        # The others were certainly not carried out, so they were sent again.
        self.assertEqual([type(first), second, third], [package.AnswerLostError, None, None])
        self.assertEqual(len(requests), 1)

    def test_a_broken_answer_ends_the_channel_and_the_next_call_opens_another(self):
        def lies(channel):
            request = receive(channel)
            send(channel, request.status(0) + b"x")
            receive(channel)

        async def work():
            async with AsyncClient(self.path) as client:
                with self.assertRaises(package.ProtocolError):
                    await client.clear_voicemail_token()
                await client.clear_voicemail_token()

        with ScriptedHelper(self.path, lies, until_the_end):
            asyncio.run(work())

    def test_no_helper_a_refusal_and_a_closed_client(self):
        async def work(kind):
            client = AsyncClient(self.path)
            with self.assertRaises(kind):
                await client.clear_voicemail_token()
            client.close()
            with self.assertRaises(package.NotConnectedError):
                await client.clear_voicemail_token()

        asyncio.run(work(package.UnreachableError))
        with FakeHelper(self.path, refusal=35):
            asyncio.run(work(package.RefusedError))

    def test_closing_ends_calls_under_way(self):
        async def work():
            client = AsyncClient(self.path)
            await client.connect()
            task = asyncio.create_task(client.clear_voicemail_token())
            await asyncio.sleep(0.01)
            client.close()
            with self.assertRaises(package.NotConnectedError):
                await task

        with FakeHelper(self.path, lambda request: None):
            asyncio.run(work())


if __name__ == "__main__":
    unittest.main()

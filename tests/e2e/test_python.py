#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The Python package and the mock's recording against the real daemon."""
import asyncio
import pathlib
import subprocess
import sys

import harness
import wire

sys.path.insert(0, str(harness.BUILD / "python"))
import brenvik_mobile_helper as package  # noqa: E402
from brenvik_mobile_helper import AsyncClient, AsyncListener, Client, Listener  # noqa: E402
from brenvik_mobile_helper.mock import Mock  # noqa: E402


class WithStore(harness.HelperTest):
    def prepare(self):
        pathlib.Path("/var/mobile/Library").mkdir(parents=True, exist_ok=True)


class Package(WithStore):
    def test_values_tokens_and_labels(self):
        value = {"text": "grün", "list": [1, 2.5, True], "data": b"\0\xff"}
        with Client() as client:
            client.set_preference_value("com.example.python", "value", value)
            self.assertEqual(client.copy_preference_value("com.example.python", "value"), value)
            large = "x" * 300_000
            client.set_preference_value("com.example.python", "large", large)
            self.assertEqual(client.copy_preference_value("com.example.python", "large"), large)
            client.set_preference_value("com.example.python", "large", None)
            self.assertIsNone(client.copy_preference_value("com.example.python", "large"))
            client.set_voicemail_token("token")
            self.assertEqual(client.copy_voicemail_token(), "token")
            self.assertEqual(client.copy_badge_labels(["USER_LABEL_BUSINESS", "", "", "My line"], ["en"]), ["B", "M"])
            self.assertEqual(client.copy_localized_labels(["USER_LABEL_TRAVEL"], ["en"]), ["Travel"])
            self.assertIs(client.copy_crash_logs("/nowhere"), False)
            with self.assertRaises(package.NoAccessError):
                client.remove_carrier_file("/etc/passwd", "")
            with self.assertRaises(package.HelperError) as caught:
                client.load_plist_file("/etc/passwd")
            self.assertEqual(caught.exception.code, 9)
            client.ping()

    def test_who_is_not_entitled_is_refused(self):
        self.assertEqual(harness.as_account("telephony", lambda: self.code_of_a_refusal()), 35)
        self.assertEqual(harness.as_account("outsider", lambda: self.code_of_a_refusal()), 35)

    @staticmethod
    def code_of_a_refusal():
        try:
            Client().connect()
        except package.RefusedError as error:
            return error.code
        return 0

    def test_many_calls_at_once_and_a_push(self):
        async def work():
            async with AsyncListener() as listener, AsyncClient() as client:
                await asyncio.gather(*(client.set_preference_value("com.example.python", str(n), n) for n in range(100)))
                got = await asyncio.gather(*(client.copy_preference_value("com.example.python", str(n)) for n in range(100)))
                await client.request_country_code_from_location(0.0, 0.0)
                event = await asyncio.wait_for(anext(listener), 20)
                return got, event

        got, event = asyncio.run(work())
        self.assertEqual(got, list(range(100)))
        self.assertIsInstance(event, package.CivicInfo)
        self.assertEqual((event.values["Client"], event.sender_uid, event.sender_pid),
                         (["BrenvikMobileHelper"], 0, self.daemon.pid))

    def test_what_is_recorded_is_replayed(self):
        record, folder = pathlib.Path("/tmp/record"), pathlib.Path("/tmp/made")
        harness.entitle("60-mock.plist")  # the mock is a program of this Python
        process = subprocess.Popen([sys.executable, harness.BUILD / "brenvik-mobile-helper-mock", "--record", record,
                                    "--directory", folder, "--pushes", wire.BOOTSTRAP],
                                   stdout=subprocess.DEVNULL, stderr=subprocess.PIPE, text=True)
        self.assertIn("listening", process.stderr.readline())

        def work(client):
            client.set_preference_value("com.example.python", "value", {"a": 1})
            value = client.copy_preference_value("com.example.python", "value")
            labels = client.copy_localized_labels(["USER_LABEL_TRAVEL"], ["de"])
            try:
                client.load_plist_file("/etc/passwd")
            except package.HelperError as error:
                return value, labels, error.code
            return None

        def ask(path, directory):
            with Client(path) as client, Listener(directory) as listener:
                got = work(client)
                client.request_country_code_from_location(0.0, 0.0)
                return got, listener.next(20).values.keys()

        real = ask(folder / wire.SERVICE, folder)
        process.terminate()
        self.assertEqual(process.wait(20), 0)
        process.stderr.close()
        with Mock(record.read_text()) as mock:
            self.assertEqual(ask(mock.path, mock.directory), real)
        self.assertEqual(mock.unscripted, [])


class IdleExit(WithStore):
    activated = True

    def test_a_client_survives_a_helper_that_was_started_anew(self):
        client = Client()
        self.addCleanup(client.close)
        client.set_voicemail_token("before")

        async def begin():
            other = AsyncClient()
            await other.connect()
            self.daemon.process.kill()
            self.daemon.process.wait(20)
            again = harness.Daemon(activated=True, listening=self.daemon.listening)
            self.daemon.listening = None
            self.daemon.stop()
            self.daemon = again
            return await other.copy_voicemail_token()

        self.assertEqual(asyncio.run(begin()), "before")
        self.assertEqual(client.copy_voicemail_token(), "before")


if __name__ == "__main__":
    harness.main()

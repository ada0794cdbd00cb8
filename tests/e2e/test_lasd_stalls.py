# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Database updates that the HTTP client has to give up on, which takes its half a minute each.

In a file of their own so that they run while other tests do.
"""
import os
import pathlib
import socket
import time

from harness import ERROR, eventually, main
from test_lasd import ALL, HOST, MANIFEST, UpdateTest, request_check


class Stalls(UpdateTest):
    def test_a_stalled_download_holds_the_process_without_any_client_until_it_is_given_up(self):
        self.server.stop()
        self.server.start(*self.good, "location /content/ { limit_rate 20; }")
        self.serve({"gsm": "1"}, lambda name, version: os.urandom(100_000))
        client = self.client()
        request_check(client, ALL)
        client.close()
        started = time.monotonic()
        eventually(lambda: "/1/v3/lasd.plist" in self.server.requests())
        time.sleep(12)  # the idle rule's ten seconds, and some
        self.assertTrue(self.daemon.running())
        self.assertEqual(self.port.texts(), [])
        self.assertEqual(self.port.wait_for(1, timeout=45), ["UpdateFailed"])
        self.assertGreater(time.monotonic() - started, 25)
        self.logs.wait_for("unified", ERROR, self.failure(f"https://{HOST}/content/gsm.db.gz", "timed out", 200, "OK"))
        self.assertEqual(self.daemon.wait(), 0, "with the token released, the idle rule ends the process")

    def test_dead_name_server(self):
        self.set_hosts()
        resolver = pathlib.Path("/etc/resolv.conf")
        before = resolver.read_text()
        self.addCleanup(resolver.write_text, before)
        # Bound, and never read: queries vanish.
        silent = socket.socket(socket.AF_INET, socket.SOCK_DGRAM)
        self.addCleanup(silent.close)
        silent.bind(("127.0.0.1", 53))
        resolver.write_text("nameserver 127.0.0.1\noptions timeout:20 attempts:5\n")
        request_check(self.client_for_all(), ALL)
        self.assertEqual(self.port.wait_for(1, timeout=45), ["UpdateFailed"])
        self.logs.wait_for("unified", ERROR, self.failure(MANIFEST, "timed out"))


if __name__ == "__main__":
    main()

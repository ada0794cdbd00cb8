# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""How the cellular heartbeat holds the process, and lets it go: the idle rule takes ten seconds each time.

In a file of its own so that it runs while other tests do.
"""
import time

from harness import main
from test_heartbeat import HeartbeatTest

LONGER_THAN_IDLE = 12


class Idle(HeartbeatTest):
    def test_a_stop_without_a_start_changes_nothing(self):
        self.switch(0).close()
        self.assertEqual(self.daemon.wait(20), 0, "idle as ever")
        self.assertEqual(self.probes(), [])

    def test_it_holds_the_process_without_any_client_and_lets_it_go_when_switched_off(self):
        self.switch(1).close()
        time.sleep(LONGER_THAN_IDLE)
        self.assertTrue(self.daemon.running())
        self.assertGreaterEqual(len(self.probes()), 6)
        self.switch(0).close()
        self.assertEqual(self.daemon.wait(20), 0)

    def test_started_twice_and_stopped_once_it_is_silent_but_the_process_stays(self):
        client = self.switch(1)
        self.switch(1, client)
        self.probes(1, 5)
        self.switch(0, client)
        client.close()
        time.sleep(1)
        self.probes()
        time.sleep(LONGER_THAN_IDLE)
        self.assertEqual(self.probes(), [])
        self.assertTrue(self.daemon.running(), "the first token is still out")


if __name__ == "__main__":
    main()

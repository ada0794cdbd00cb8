# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The example of a telephony daemon: an account without rights, and sockets that somebody else made for it."""
import grp
import os
import pathlib
import plistlib
import pwd
import shutil
import socket
import struct
import subprocess
import threading

import harness
import wire
from harness import BUILD, HelperTest, eventually, main

PROGRAM = pathlib.Path("/var/brenvikd")  # where only root may write, as an entitled program must be
PUSHES, NOTIFICATIONS = "com.norvale.brenvik", "com.norvale.Brenvik.lasd"


class Brenvikd:
    """Started as the service manager would: with its account, and its two sockets from descriptor 3 on."""

    def __init__(self, test, names=(PUSHES, NOTIFICATIONS)):
        self.sockets = []
        for name in names:
            sock = harness.listen(f"{wire.BOOTSTRAP}/{name}")
            os.chmod(f"{wire.BOOTSTRAP}/{name}", 0o600)  # root's alone, as the example units make them
            self.sockets.append(sock)
        account = pwd.getpwnam("telephony")
        groups = [each.gr_gid for each in grp.getgrall() if each.gr_name == "brenvik"]
        shuffle = " ".join(f"{3 + i}<&{sock.fileno()}" for i, sock in enumerate(self.sockets))
        # LISTEN_PID must be its own, so a shell sets it and becomes the daemon; bash, since descriptors may have two digits.
        self.process = subprocess.Popen(
            ["/bin/bash", "-c", f'exec {shuffle}; LISTEN_PID=$$ exec "$@"', "bash", str(PROGRAM)],
            env={"LISTEN_FDS": str(len(names)), "LISTEN_FDNAMES": ":".join(names)}, text=True,
            stdout=subprocess.PIPE, stderr=subprocess.PIPE, pass_fds=[sock.fileno() for sock in self.sockets],
            user=account.pw_uid, group=account.pw_gid, extra_groups=groups)
        test.addCleanup(self.close)
        self.lines = []
        self.thread = threading.Thread(target=self._read, daemon=True)
        self.thread.start()

    def _read(self):
        for line in self.process.stdout:
            self.lines.append(line.rstrip())

    def close(self):
        self.process.kill()
        self.process.wait()
        self.thread.join()
        self.process.stdout.close()
        self.process.stderr.close()
        for sock in self.sockets:
            sock.close()


class TelephonyDaemon(HelperTest):
    def prepare(self):
        shutil.copy(BUILD / "examples" / "brenvikd", PROGRAM)

    def test_an_unprivileged_daemon_receives_pushes_and_notifications(self):
        self.entitle_it()
        daemon = Brenvikd(self)
        eventually(lambda: 'country "NO", city "Oslo"' in daemon.lines, what="the push of where it is")
        self.logs.wait_for("bsd", harness.LOG_NOTICE, "sendCivicInfoToQV sent civic info to Brenvik successfully")
        with socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET) as updater:
            updater.connect(f"{wire.BOOTSTRAP}/{NOTIFICATIONS}")
            updater.send(struct.pack("<6I", 0, 24, 0, 0, 0, 0)
                         + plistlib.dumps({"Notification": "com.norvale.lasd.NoUpdateRequired"}, fmt=plistlib.FMT_BINARY))
        eventually(lambda: 'notification "com.norvale.lasd.NoUpdateRequired"' in daemon.lines, what="the notification")

    def test_a_daemon_whose_account_is_not_entitled_says_so_and_ends(self):
        daemon = Brenvikd(self)
        self.assertEqual(daemon.process.wait(20), 1)
        self.assertIn("the helper does not let us in: the caller lacks the entitlement", daemon.process.stderr.read())

    def test_a_daemon_without_its_sockets_says_so_and_ends(self):
        self.entitle_it()
        daemon = Brenvikd(self, names=("com.norvale.other",))
        self.assertEqual(daemon.process.wait(20), 1)
        self.assertEqual(daemon.process.stderr.read(),
                         "brenvikd: no sockets: the service manager handed over no such socket\n")

    def entitle_it(self):
        harness.entitle("60-brenvikd.plist", executable=PROGRAM, user="telephony")


if __name__ == "__main__":
    main()

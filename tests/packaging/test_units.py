#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The units: what systemd says of them, and that each service unit explains every point that is open.

BRENVIK_BUILD names the build folder, BRENVIK_SOURCE the project's.
"""
import ipaddress
import json
import os
import pathlib
import re
import shutil
import subprocess
import tempfile
import unittest

BUILD = pathlib.Path(os.environ["BRENVIK_BUILD"])
SOURCE = pathlib.Path(os.environ["BRENVIK_SOURCE"])
SERVICE = "brenvik-mobile-helper.service"
NETWORK = "brenvik-network-worker.service"
STORES = "brenvik-store-worker.service"
CALLERS = "brenvik-caller-worker.service"
RESTORE = "brenvik-mobile-helper-restore.service"
# How exposed each may be, in tenths, and at how much its first comment puts it.
MOST_EXPOSED = {SERVICE: 16, NETWORK: 16, STORES: 9, CALLERS: 12}
SAID = {SERVICE: 1.6, NETWORK: 1.1, STORES: 0.4, CALLERS: 1.0}


def service_manager():
    """The version that the units were made for."""
    return int(re.search(r"^systemd_VERSION:\w+=(\d+)", (BUILD / "CMakeCache.txt").read_text(), re.M)[1])


@unittest.skipUnless(shutil.which("systemd-analyze"), "systemd-analyze is not installed")
class Units(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        folder = tempfile.TemporaryDirectory(prefix="brenvik-units-")
        cls.addClassCleanup(folder.cleanup)
        cls.folder = pathlib.Path(folder.name)
        for name in (*MOST_EXPOSED, *(each.replace(".service", ".socket") for each in MOST_EXPOSED)):
            # Only programs that are there pass the check; which one does not matter to it.
            text = (BUILD / "units" / name).read_text()
            lines = ["ExecStart=/bin/true" if line.startswith("ExecStart=") else line for line in text.splitlines()]
            (cls.folder / name).write_text("\n".join(lines) + "\n")
        shutil.copy(SOURCE / "units" / RESTORE, cls.folder)
        cls.texts = {name: (cls.folder / name).read_text() for name in MOST_EXPOSED}
        cls.text = cls.texts[SERVICE]

    def analyze(self, *arguments, name=SERVICE):
        return subprocess.run(["systemd-analyze", *arguments, f"./{name}"], cwd=self.folder, capture_output=True,
                              text=True, timeout=60, check=False)

    def test_they_are_well_formed(self):
        for name in sorted(each.name for each in self.folder.iterdir()):
            done = self.analyze("verify", "--man=no", name=name)
            self.assertEqual((done.returncode, done.stderr), (0, ""), name)

    def exposure(self, name):
        done = self.analyze("security", "--offline=true", "--no-pager", name=name)
        return float(re.search(rf"Overall exposure level for {name}: ([0-9.]+)", done.stdout)[1])

    def test_no_service_is_more_exposed_than_it_may_be_or_says(self):
        for name, most in MOST_EXPOSED.items():
            with self.subTest(name):
                done = self.analyze("security", "--offline=true", f"--threshold={most}", "--no-pager", name=name)
                self.assertEqual(done.returncode, 0, done.stdout[-200:] + done.stderr)
                self.assertEqual(self.exposure(name), SAID[name])
                said = re.search(r"`systemd-analyze security` puts it at ([0-9.]+)[.;]", self.texts[name])
                self.assertEqual(float(said[1]), SAID[name])

    def test_a_weaker_unit_would_not_pass(self):
        weaker = self.text.replace("ProtectSystem=strict", "ProtectSystem=no")
        (self.folder / "weaker.service").write_text(weaker)
        self.addCleanup((self.folder / "weaker.service").unlink)
        done = self.analyze("security", "--offline=true", f"--threshold={MOST_EXPOSED[SERVICE]}", "--no-pager", name="weaker.service")
        self.assertNotEqual(done.returncode, 0)

    def test_each_worker_listens_where_the_helper_looks_and_for_root_alone(self):
        places = (BUILD / "CMakeCache.txt").read_text()
        bootstrap = re.search(r"^BRENVIK_BOOTSTRAP_DIRECTORY:\w+=(.*)$", places, re.M)[1]
        for worker, service in (("caller", "callers"), ("network", "network"), ("store", "stores")):
            text = (self.folder / f"brenvik-{worker}-worker.socket").read_text()
            name = f"com.norvale.brenvik.mobile-helper.{service}"
            for line in (f"ListenSequentialPacket={bootstrap}/{name}", f"FileDescriptorName={name}", "SocketUser=root",
                         "SocketGroup=root", "SocketMode=0600", f"OnFailure={RESTORE}"):
                self.assertIn(f"\n{line}\n", text, worker)
            started = (BUILD / "units" / f"brenvik-{worker}-worker.service").read_text()
            self.assertRegex(started, rf"\nExecStart=/\S+/brenvik/brenvik-{worker}-worker\n")

    def test_the_way_back_knows_every_socket(self):
        text = (SOURCE / "units" / RESTORE).read_text()
        for name in MOST_EXPOSED:
            self.assertRegex(text, rf"\nExecStart=\S+ reset-failed .*\b{re.escape(name)}\b")
            self.assertRegex(text, rf"\nExecStart=\S+ start --no-block .*\b{re.escape(name.replace('.service', '.socket'))}\b")

    def values(self, key, name=SERVICE):
        """The words of all lines of a service unit with this key."""
        return [word for line in self.texts[name].splitlines() if line.startswith(f"{key}=")
                for word in line.split("=", 1)[1].split()]

    def test_only_the_network_worker_has_a_network(self):
        for name in (SERVICE, STORES, CALLERS):
            self.assertEqual((self.values("PrivateNetwork", name), self.values("RestrictAddressFamilies", name),
                              self.values("IPAddressDeny", name), self.values("IPAddressAllow", name)),
                             (["yes"], ["AF_UNIX"], ["any"], []), name)

    def test_only_the_caller_worker_can_look_into_processes_and_that_is_all_it_can(self):
        self.assertEqual(self.values("CapabilityBoundingSet"), ["CAP_CHOWN", "CAP_FOWNER", "CAP_DAC_OVERRIDE"])
        for key in ("CapabilityBoundingSet", "AmbientCapabilities"):
            self.assertEqual(self.values(key, CALLERS), ["CAP_SYS_PTRACE"])
        self.assertEqual(self.values("DynamicUser", CALLERS), ["yes"])
        self.assertEqual(self.values("Wants"), [CALLERS], "the first caller waits for it")

    def test_no_other_worker_has_a_capability_or_roots_account(self):
        for name in (NETWORK, STORES):
            self.assertIn("\nCapabilityBoundingSet=\n", self.texts[name])
            self.assertIn("\nAmbientCapabilities=\n", self.texts[name])
        self.assertEqual((self.values("DynamicUser", NETWORK), self.values("User", STORES)), (["yes"], ["mobile"]))

    def test_nothing_can_be_stored_in_the_place_of_the_homes_it_hides(self):
        self.assertEqual(self.values("ProtectHome"), ["tmpfs"])
        hidden = ["/home:ro", "/root:ro", "/run/user:ro"] + (["/run/host:ro"] if service_manager() >= 255 else [])
        self.assertEqual(sorted(self.values("TemporaryFileSystem")), sorted(hidden))

    def test_a_private_tmp_is_in_memory_where_the_service_manager_can_make_it_so(self):
        wanted = ["yes", "disconnected"] if service_manager() >= 257 else ["yes"]
        for name in (NETWORK, STORES):
            self.assertEqual(self.values("PrivateTmp", name), wanted, name)
        # It would take the place of the machine's /tmp, where packages arrive.
        self.assertEqual(self.values("PrivateTmp"), ["yes"])

    def test_the_link_to_os_release_of_newer_service_managers_has_a_place_of_its_own(self):
        for name in MOST_EXPOSED:
            if self.values("RootDirectory", name):
                self.assertEqual("/run/host:ro" in self.values("TemporaryFileSystem", name), service_manager() >= 255, name)

    def test_the_folders_that_are_bound_in_are_made_before_it_starts(self):
        made = {line.split()[1] for line in (BUILD / "units" / "brenvik.tmpfiles").read_text().splitlines()
                if line.startswith("d ")}
        for path in set(self.values("BindPaths")) - {"/tmp"}:
            self.assertTrue(path.startswith("-"), f"it would not start without {path}")
            self.assertIn(path.lstrip("-"), made)
        for name in (SERVICE, STORES, CALLERS):
            self.assertLessEqual(set(self.values("RootDirectory", name)), made)
            self.assertIn("systemd-tmpfiles-setup.service", self.values("After", name))
        self.assertIn("/root/Library/Preferences", made)

    def test_servers_behind_every_kind_of_unicast_address_are_reachable(self):
        allowed = [ipaddress.ip_network(each) for each in self.values("IPAddressAllow", NETWORK)]
        self.assertEqual(self.values("IPAddressDeny", NETWORK), ["any"])

        def is_allowed(address):
            return any(ipaddress.ip_address(address) in network for network in allowed)
        # 64:ff9b::/96 and 64:ff9b:1::/48: IPv4 servers as a network without IPv4 sees them (RFC 6052, RFC 8215).
        for address in ("127.0.0.1", "9.9.9.9", "198.51.100.7", "223.255.255.254", "::1", "2001:db8::1", "fd00::1",
                        "fe80::1", "64:ff9b::9.9.9.9", "64:ff9b::ffff:ffff", "64:ff9b:1::1", "64:ff9b:1:ffff::9.9.9.9"):
            self.assertTrue(is_allowed(address), address)
        for address in ("224.0.0.1", "255.255.255.255", "ff02::1", "::", "64:ff9b:0:0:0:1::", "64:ff9b:2::1", "100::1"):
            self.assertFalse(is_allowed(address), address)

    def test_every_open_point_is_named_with_its_weight(self):
        for name, text in self.texts.items():
            done = self.analyze("security", "--offline=true", "--json=short", "--no-pager", name=name)
            items = json.loads(done.stdout)
            wanted = {f"# Open: {each['name']} {each['exposure']}" for each in items if not each["set"] and each["exposure"]}
            self.assertGreater(len(wanted), 3)
            named = {line.split(". ")[0] for line in text.splitlines() if line.startswith("# Open: ")}
            self.assertEqual(named, wanted, name)

    def test_the_example_units_of_a_telephony_daemon_are_well_formed(self):
        examples = SOURCE / "client" / "examples" / "brenvikd"
        names = sorted(each.name for each in examples.iterdir() if each.suffix in (".service", ".socket"))
        self.assertEqual(names, ["brenvikd-lasd.socket", "brenvikd.service", "brenvikd.socket"])
        for name in names:
            text = (examples / name).read_text().replace("ExecStart=/usr/libexec/brenvikd", "ExecStart=/bin/true")
            (self.folder / name).write_text(text)
        for name in names:
            done = self.analyze("verify", "--man=no", name=name)
            self.assertEqual((done.returncode, done.stderr), (0, ""), name)

    def allowed_calls(self, name):
        """The system calls that a service may make, as the service manager counts: line by line, sets unfolded."""
        def unfolded(name):
            if not name.startswith("@"):
                return {name}
            shown = subprocess.run(["systemd-analyze", "syscall-filter", "--no-pager", name], capture_output=True, text=True,
                                   timeout=60, check=True).stdout
            lines = [line.strip() for line in shown.splitlines()[1:]]
            return set().union(*(unfolded(line) for line in lines if line and not line.startswith("#")))

        allowed = set()
        for line in re.findall(r"^SystemCallFilter=(.*)", self.texts[name], re.M):
            names = set().union(*map(unfolded, line.removeprefix("~").split()))
            allowed = allowed - names if line.startswith("~") else allowed | names
        return allowed

    def test_nobody_reaches_into_another_process_or_hands_out_resources(self):
        for name in MOST_EXPOSED:
            allowed = self.allowed_calls(name)
            self.assertLessEqual({"read", "epoll_wait", "poll", "openat", "sendmsg", "memfd_create", "prlimit64"}, allowed, name)
            self.assertEqual(allowed & {"ptrace", "process_vm_readv", "process_vm_writev", "process_madvise",
                                        "process_mrelease", "pidfd_getfd", "kcmp", "userfaultfd", "perf_event_open", "bpf",
                                        "sched_setscheduler", "sched_setattr",
                                        "sched_setparam", "sched_setaffinity", "setrlimit", "nice", "mbind",
                                        "migrate_pages", "move_pages", "setuid", "setresuid", "setgroups", "mount",
                                        "add_key", "keyctl", "shmget", "personality", "io_uring_setup"}, set(), name)

    def test_of_roots_calls_each_has_what_it_needs(self):
        self.assertLessEqual({"chown", "fchownat", "capset"}, self.allowed_calls(SERVICE))
        for name in (NETWORK, STORES, CALLERS):
            self.assertEqual(self.allowed_calls(name) & {"chown", "fchown", "fchownat", "lchown", "chroot", "capset"},
                             {"capset"}, name)

    def test_utility_work_may_lower_its_priorities_or_has_low_ones(self):
        lowering = {"setpriority", "ioprio_set"}
        self.assertEqual(self.allowed_calls(SERVICE) & lowering, lowering)
        for name in (NETWORK, STORES, CALLERS):
            self.assertEqual(self.allowed_calls(name) & lowering, set(), name)
        self.assertEqual((self.values("Nice", NETWORK), self.values("IOSchedulingPriority", NETWORK)), (["10"], ["7"]))


if __name__ == "__main__":
    unittest.main()

#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""How long the service manager takes from a connection to the first reply, the whole sandbox of the unit included,
beside systemd-hostnamed, which is started by a message on the system bus. Runs in a container, as root, once.

usage: activation.py [--rounds N] [--directives] [--worker] [UNIT.service ...]
  --directives   also the installed unit without each of its directives, one at a time
  --worker       also with the caller worker's unit without each of its directives, one at a time, and without any
  UNIT.service   also these, in place of the installed unit, or of the caller worker's if they start its program

Contestants take turns. Ratios are of medians; the middle half of all times stands beside each. The last time is the
processor time of the service's process until then, the making of its sandbox included: it says more where others are at work
on the machine.
"""
import argparse
import ctypes
import glob
import os
import pathlib
import plistlib
import re
import statistics
import subprocess
import sys
import time

SERVICE = pathlib.Path("/lib/systemd/system/brenvik-mobile-helper.service")
SOCKET = pathlib.Path("/lib/systemd/system/brenvik-mobile-helper.socket")
WORKER = pathlib.Path("/lib/systemd/system/brenvik-caller-worker.service")
SERVICE_PATH = "/run/brenvik/bootstrap/com.norvale.brenvik.mobile-helper"
PEER = "systemd-hostnamed.service"
MOST_OF_PEER = 0.45
# Seconds after each. A service that leaves when idle is started on a machine that has rested, ten seconds later at the earliest;
# and what the kernel takes down afterwards (namespaces, control groups) is not to be measured.
REST = 0.3
# These go together: without them the service manager takes the whole machine's tree, and changes that.
A_ROOT_OF_ITS_OWN = ("RootDirectory", "BindReadOnlyPaths", "BindPaths")
# What makes the service start at all; the rest is the sandbox.
NOT_SANDBOX = ("Type=", "ExecStart=", "Restart=", "SyslogIdentifier=", "StandardOutput=", "StandardError=", "StateDirectory=",
               "TimeoutStopSec=", "NotifyAccess=")


def run(*command, check=True):
    done = subprocess.run([str(each) for each in command], capture_output=True, text=True, timeout=120, check=False)
    if check and done.returncode != 0:
        raise AssertionError(f"{' '.join(map(str, command))}: status {done.returncode}\n{done.stdout}{done.stderr}")
    return done.stdout


class Helper:
    """The service with one form of its unit: the installed socket unit under a name and a path of its own."""
    library = None

    def __init__(self, label, number, text, worker=None):
        self.worker = worker
        self.label, self.unit, self.path = label, f"activation{number}.service", f"/run/activation/{number}"
        self.times, self.processor = [], []
        units = pathlib.Path("/run/systemd/system")
        often = re.sub(r"^StartLimit\w+=.*\n", "", text, flags=re.M)
        often = re.sub(r"^\[Unit\]$", "[Unit]\nStartLimitIntervalSec=0", often, flags=re.M)
        (units / self.unit).write_text(often.replace(SOCKET.name, f"activation{number}.socket"))
        listening = SOCKET.read_text().replace(SERVICE_PATH, self.path)
        (units / f"activation{number}.socket").write_text(re.sub(r"^OnFailure=.*\n", "", listening, flags=re.M))

    def prepare(self):
        run("systemctl", "start", self.unit.replace(".service", ".socket"))

    def first_reply(self):
        if Helper.library is None:
            Helper.library = ctypes.CDLL("libbrenvik-mobile-helper.so.0")
            Helper.library.bvmh_client_create.restype = ctypes.c_void_p
            for name in ("bvmh_client_free", "bvmh_connect", "bvmh_client_set_socket"):
                getattr(Helper.library, name).argtypes = [ctypes.c_void_p]
            Helper.library.bvmh_client_set_socket.argtypes = [ctypes.c_void_p, ctypes.c_char_p]
        client = Helper.library.bvmh_client_create()
        code = Helper.library.bvmh_client_set_socket(client, self.path.encode())
        began = time.monotonic()
        code = code or Helper.library.bvmh_connect(client)
        took = time.monotonic() - began
        Helper.library.bvmh_client_free(client)
        if code != 0:
            raise AssertionError(f"{self.label}: the check-in failed with {code}")
        return took


class Peer:
    """systemd-hostnamed, asked for one property over a connection that is made for it."""
    label, unit = PEER, PEER

    def __init__(self):
        self.times, self.processor = [], []
        self.library = ctypes.CDLL("libsystemd.so.0")

    def prepare(self):
        run("systemctl", "start", "dbus.socket", "dbus.service")

    def first_reply(self):
        bus, text = ctypes.c_void_p(), ctypes.c_char_p()
        began = time.monotonic()
        code = self.library.sd_bus_open_system(ctypes.byref(bus))
        if code >= 0:
            code = self.library.sd_bus_get_property_string(bus, b"org.freedesktop.hostname1", b"/org/freedesktop/hostname1",
                                                           b"org.freedesktop.hostname1", b"Hostname", None,
                                                           ctypes.byref(text))
        took = time.monotonic() - began
        self.library.sd_bus_flush_close_unref(bus)
        if code < 0:
            raise AssertionError(f"{PEER}: {os.strerror(-code)}")
        return took


def directives(text):
    """The lines of the [Service] section that make up the sandbox."""
    section = text.split("\n[Service]\n", 1)[1]
    return [line for line in section.splitlines()
            if re.match(r"[A-Z]\w+=", line) and not line.startswith(NOT_SANDBOX)]


def without_sandbox(text):
    for line in directives(text):
        text = text.replace(line + "\n", "", 1)
    return text


def contestants(arguments):
    text = SERVICE.read_text()
    forms = [("as installed", text), ("without any sandbox", without_sandbox(text))]
    for each in arguments.units:
        other = pathlib.Path(each).read_text()
        forms.append((pathlib.Path(each).stem, *((text, other) if "/brenvik-caller-worker\n" in other else (other,))))
    if arguments.directives:
        names = [(name,) for name in dict.fromkeys(line.split("=")[0] for line in directives(text))
                 if name not in A_ROOT_OF_ITS_OWN]
        forms += [(f"without {'=, '.join(each)}=", re.sub(rf"^({'|'.join(each)})=.*\n", "", text, flags=re.M))
                  for each in [A_ROOT_OF_ITS_OWN, *names]]
    if arguments.worker:
        worker = WORKER.read_text()
        kept = ("CapabilityBoundingSet", "AmbientCapabilities", "DynamicUser", *A_ROOT_OF_ITS_OWN)
        names = [name for name in dict.fromkeys(line.split("=")[0] for line in directives(worker)) if name not in kept]
        forms += [("worker without any sandbox", text, without_sandbox(worker))]
        forms += [(f"worker without {'=, '.join(each)}=", text, re.sub(rf"^({'|'.join(each)})=.*\n", "", worker, flags=re.M))
                  for each in [A_ROOT_OF_ITS_OWN, *((name,) for name in names)]]
    return [Peer(), *(Helper(form[0], number, *form[1:]) for number, form in enumerate(forms))]


def with_worker(text):
    """From now on the caller worker's unit is this; None: the installed one."""
    file = pathlib.Path("/run/systemd/system", WORKER.name)
    if text == (file.read_text() if file.exists() else None):
        return
    if text is None:
        file.unlink()
    else:
        file.write_text(text)
    run("systemctl", "daemon-reload")


def main():
    parser = argparse.ArgumentParser(add_help=False)
    parser.add_argument("--rounds", type=int, default=25)
    parser.add_argument("--directives", action="store_true")
    parser.add_argument("--worker", action="store_true")
    parser.add_argument("units", nargs="*")
    arguments = parser.parse_args()

    run("dpkg", "-i", *glob.glob("/packages/*_*.deb"))
    file = pathlib.Path("/etc/brenvik/entitlements.d/70-test.plist")
    file.write_bytes(plistlib.dumps({"Executable": os.path.realpath(sys.executable),
                                     "Entitlements": {"com.norvale.Teravox.BrenvikHelper.allow": True}}))
    os.chmod(file, 0o644)
    all_of_them = contestants(arguments)
    run("systemctl", "daemon-reload")
    for each in all_of_them:
        each.prepare()
    for turn in range(-1, arguments.rounds):  # the first is for files that have to come from the disk
        for each in all_of_them if turn % 2 else reversed(all_of_them):
            with_worker(getattr(each, "worker", None))
            took = each.first_reply()
            if turn >= 0:
                each.times.append(took)
                process = run("systemctl", "show", "-P", "MainPID", each.unit).strip()
                each.processor.append(int(pathlib.Path(f"/proc/{process}/schedstat").read_text().split()[0]) / 1e9)
            run("systemctl", "stop", each.unit)
            time.sleep(REST)

    floor = statistics.median(all_of_them[0].times)
    installed = statistics.median(all_of_them[1].times)
    for each in all_of_them:
        middle = statistics.median(each.times)
        quarters = statistics.quantiles(each.times, n=4)
        processor = statistics.median(each.processor)
        print(f"{1000 * middle:7.1f} ms ({1000 * quarters[0]:5.1f} to {1000 * quarters[2]:5.1f})"
              f"   ratio {middle / floor:.2f}   {1000 * processor:5.1f} ms   {each.label}", flush=True)
    ratio = installed / floor
    print(f"connect to reply, beside {PEER}: {ratio:.2f} (limit {MOST_OF_PEER})", flush=True)
    return 0 if ratio <= MOST_OF_PEER else 1


if __name__ == "__main__":
    sys.exit(main())

#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""What a program could do that runs in the place of a service: started by its unit, in its sandbox, it tries everything
and prints, as JSON, what came of each attempt: "done", a value, or the name of the error.

usage: probe.py VICTIM    the number of a process of root's that has nothing to do with any of this
"""
import ctypes
import errno
import json
import os
import socket
import sys

CALLERS = "/run/brenvik/bootstrap/com.norvale.brenvik.mobile-helper.callers"
LIBC = ctypes.CDLL(None, use_errno=True)
# Each architecture has numbers of its own for the older system calls.
PROCESS_VM_READV, PROCESS_VM_WRITEV, PTRACE, SYSLOG = {"x86_64": (310, 311, 101, 103),
                                                       "aarch64": (270, 271, 117, 116)}[os.uname().machine]
PIDFD_OPEN, PIDFD_GETFD = 434, 438


def attempt(function, *arguments):
    try:
        value = function(*arguments)
    except OSError as error:
        return errno.errorcode[error.errno]
    return "done" if value is None else value


def call(number, *arguments):
    # pointers and counts are long; None stays a null pointer
    value = LIBC.syscall(ctypes.c_long(number), *(ctypes.c_long(each) for each in arguments))
    if value < 0:
        raise OSError(ctypes.get_errno(), "")


def writes_memory(path):
    # Opened is enough: whoever has this descriptor writes wherever it likes.
    os.close(os.open(path, os.O_WRONLY))


def opens_socket(family, kind):
    socket.socket(family, kind).close()


def signals(process):
    os.kill(process, 0)


def takes_descriptor(process):
    pidfd = LIBC.syscall(PIDFD_OPEN, process, 0)
    if pidfd < 0:
        raise OSError(ctypes.get_errno(), "")
    call(PIDFD_GETFD, pidfd, 0, 0)


def written(folder):
    path = os.path.join(folder, "brenvik-probe")
    os.close(os.open(path, os.O_WRONLY | os.O_CREAT | os.O_EXCL, 0o600))
    os.unlink(path)


def told(folder):
    """What the caller worker says about a process's folder in /proc; empty when it hangs up."""
    with socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET) as worker:
        worker.connect(CALLERS)
        ours, theirs = socket.socketpair(socket.AF_UNIX, socket.SOCK_SEQPACKET)
        with ours, theirs:
            ours.settimeout(20)
            socket.send_fds(worker, [b"\1\0\0\0"], [theirs.fileno()])
            theirs.close()
            descriptor = os.open(folder, os.O_PATH)
            socket.send_fds(ours, [b"\1\0\0\0"], [descriptor])
            os.close(descriptor)
            return ours.recv(65536).decode("latin-1")


def writable_places():
    """Every folder in which a file could be made, without those inside another one of them."""
    found = []
    for folder, folders, _ in os.walk("/"):
        if attempt(written, folder) == "done":
            found.append(folder)
            folders.clear()
        folders[:] = [each for each in folders if os.path.join(folder, each) != "/proc"]
    return sorted(found)


def main():
    victim = int(sys.argv[1])
    result = {
        "account": [os.geteuid(), os.getegid(), sorted(set(os.getgroups()))],
        "memory": attempt(writes_memory, f"/proc/{victim}/mem"),
        "vm_write": attempt(call, PROCESS_VM_WRITEV, victim, 0, 0, 0, 0, 0),
        "vm_read": attempt(call, PROCESS_VM_READV, victim, 0, 0, 0, 0, 0),
        "ptrace": attempt(call, PTRACE, 16, victim, 0, 0),
        "take_descriptor": attempt(takes_descriptor, victim),
        "signal": attempt(signals, victim),
        "inet": attempt(opens_socket, socket.AF_INET, socket.SOCK_STREAM),
        "inet6": attempt(opens_socket, socket.AF_INET6, socket.SOCK_DGRAM),
        "netlink": attempt(opens_socket, socket.AF_NETLINK, socket.SOCK_RAW),
        "packet": attempt(opens_socket, socket.AF_PACKET, socket.SOCK_RAW),
        "raw": attempt(socket.socket, socket.AF_INET, socket.SOCK_RAW, socket.IPPROTO_ICMP)
               if attempt(opens_socket, socket.AF_INET, socket.SOCK_DGRAM) == "done" else "no network",
        "root_account": attempt(os.setresuid, 0, 0, 0) if os.geteuid() != 0 else "done",
        "writable": writable_places(),
        "settings": attempt(lambda: os.close(os.open("/proc/sys/kernel/core_pattern", os.O_WRONLY))),
        "kernel_log": attempt(call, SYSLOG, 10, 0, 0),
        "kernel_log_file": attempt(lambda: os.close(os.open("/proc/kmsg", os.O_RDONLY))),
        "kernel_log_device": attempt(lambda: os.close(os.open("/dev/kmsg", os.O_WRONLY))),
        "symbols": attempt(lambda: os.close(os.open("/proc/kallsyms", os.O_RDONLY))),
        "host_name": attempt(socket.sethostname, "brenvik-probe"),
    }
    for folder in ("/home", "/root", "/var/mobile", "/run/user", "/tmp"):
        result["sees " + folder] = attempt(lambda: sorted(os.listdir(folder)))
    with open("/proc/self/status", encoding="utf-8") as status:
        result["filters"] = next(int(line.split()[1]) for line in status if line.startswith("Seccomp_filters:"))
    # The way around: another process's root, and what is mounted there.
    result["around"] = attempt(lambda: sorted(os.listdir("/proc/1/root/home")))
    result["memory_around"] = attempt(writes_memory, f"/proc/1/root/proc/{victim}/mem")
    # What it is told of another process's program, and of a link that somebody else could have made.
    result["told"] = attempt(told, f"/proc/{victim}")
    folder = "/tmp/brenvik-probe"
    if attempt(os.mkdir, folder) == "done":
        os.symlink("/proc/1/root/etc/hostname", folder + "/exe")
        result["told_of_a_link"] = attempt(told, folder)
        os.unlink(folder + "/exe")
        os.rmdir(folder)
    print(json.dumps({key: "done" if isinstance(value, socket.socket) else value for key, value in result.items()}))


if __name__ == "__main__":
    main()

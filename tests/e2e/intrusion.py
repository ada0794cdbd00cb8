# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""What a program of the same account can do with another one: look into it, and take what it holds."""
import contextlib
import ctypes
import errno
import os
import struct
import sys


def ways_into(pid):
    """What this process can do with another one of its account beyond signals: the names of what succeeds."""
    libc = ctypes.CDLL(None, use_errno=True)
    word = ctypes.create_string_buffer(8)
    vector = struct.pack("NN", ctypes.addressof(word), 8)
    theirs = struct.pack("NN", 0x400000, 8)
    pidfd = os.pidfd_open(pid)
    calls = {"pidfd_getfd": lambda: libc.syscall(438, pidfd, 0, 0),
             "process_vm_readv": lambda: libc.process_vm_readv(pid, vector, 1, theirs, 1, 0),
             "PTRACE_SEIZE": lambda: libc.ptrace(0x4206, pid, 0, 0),
             "PTRACE_ATTACH": lambda: libc.ptrace(16, pid, 0, 0)}
    found = []
    for name, call in calls.items():
        ctypes.set_errno(0)
        if call() >= 0 or ctypes.get_errno() not in (errno.EPERM, errno.EACCES):
            found.append(f"{name}: {os.strerror(ctypes.get_errno())}")
    folder = f"/proc/{pid}"
    for name in ("mem", "maps", "environ", "auxv", "syscall", "stack", "fd/0", "task", "coredump_filter", "oom_score_adj"):
        with contextlib.suppress(PermissionError):
            if name == "task":
                os.listdir(f"{folder}/task/{pid}/fd")
            else:
                os.close(os.open(f"{folder}/{name}", os.O_RDWR if name in ("mem", "oom_score_adj", "coredump_filter") else os.O_RDONLY))
            found.append(name)
    for name in ("cwd", "root", "exe", "fd/0", "ns/mnt"):
        with contextlib.suppress(PermissionError):
            os.readlink(f"{folder}/{name}")
            found.append(f"link {name}")
    return found


def tell_ways_into(pid):
    """How many there are."""
    found = ways_into(pid)
    sys.stderr.write("".join(f"a way into the worker: {each}\n" for each in found))
    return len(found)

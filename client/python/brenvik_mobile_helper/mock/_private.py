# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Runs a command that finds the mock's folder where the helper's sockets are looked for. A program of its own, because what it
does to itself cannot be undone.

usage: _private.py BOOTSTRAP_DIRECTORY FOLDER COMMAND [ARGUMENT...]
"""
import ctypes
import os
import stat
import sys
import tempfile

_NEW_MOUNTS, _NEW_USER = 0x00020000, 0x10000000  # CLONE_NEWNS, CLONE_NEWUSER
_BIND, _RECURSIVE, _PRIVATE, _DETACH = 0x1000, 0x4000, 0x40000, 2  # MS_BIND, MS_REC, MS_PRIVATE, MNT_DETACH
_libc = ctypes.CDLL(None, use_errno=True)


def _checked(result: int, what: str) -> None:
    if result:
        number = ctypes.get_errno()
        raise OSError(number, f"{what}: {os.strerror(number)}")


def _mount(source: str, target: str, kind: str | None, flags: int) -> None:
    _checked(_libc.mount(os.fsencode(source), os.fsencode(target), kind.encode() if kind else None, ctypes.c_ulong(flags), None),
             f"mounting at {target}")


def _write(path: str, text: str) -> None:
    with open(path, "w", encoding="ascii") as file:
        file.write(text)


def make_private_mounts() -> None:
    """From now on this process mounts for itself alone. Who is not root needs a user namespace for it, in which the
    account stays what it is."""
    if _libc.unshare(_NEW_MOUNTS):
        user, group = os.geteuid(), os.getegid()
        _checked(_libc.unshare(_NEW_MOUNTS | _NEW_USER), "making a user namespace")
        _write("/proc/self/setgroups", "deny")
        _write("/proc/self/uid_map", f"{user} {user} 1")
        _write("/proc/self/gid_map", f"{group} {group} 1")
    _mount("none", "/", None, _RECURSIVE | _PRIVATE)


def put_in_place(folder: str, bootstrap: str) -> None:
    """Makes the folder appear as the bootstrap directory, which may not be there yet."""
    if os.path.isdir(bootstrap):
        _mount(folder, bootstrap, None, _BIND)
        return
    # What is there of the path cannot be written, so it is covered by a copy of its entries and the rest of the path.
    existing = os.path.dirname(bootstrap)
    while not os.path.isdir(existing):
        existing = os.path.dirname(existing)
    if existing == "/":
        raise OSError(0, f"no folder above {bootstrap} exists")
    copy = tempfile.mkdtemp(prefix="brenvik-mock-")
    try:
        _mount("tmpfs", copy, "tmpfs", 0)
        for entry in os.scandir(existing):
            target = os.path.join(copy, entry.name)
            if entry.is_symlink():
                os.symlink(os.readlink(entry.path), target)
                continue
            if stat.S_ISDIR(entry.stat(follow_symlinks=False).st_mode):
                os.mkdir(target)
            else:
                os.close(os.open(target, os.O_CREAT | os.O_WRONLY, 0o600))
            _mount(entry.path, target, None, _BIND | _RECURSIVE)
        place = os.path.join(copy, os.path.relpath(bootstrap, existing))
        os.makedirs(place)
        _mount(folder, place, None, _BIND)
        _mount(copy, existing, None, _BIND | _RECURSIVE)
        _checked(_libc.umount2(os.fsencode(copy), _DETACH), f"unmounting {copy}")
    finally:
        os.rmdir(copy)


def main(arguments: list[str]) -> int:
    bootstrap, folder, *command = arguments
    # Mounts may hide where we stand.
    here = os.open(".", os.O_PATH | os.O_DIRECTORY)
    try:
        make_private_mounts()
        put_in_place(os.path.abspath(folder), bootstrap)
    except OSError as error:
        sys.stderr.write(f"brenvik-mobile-helper-mock: cannot put the mock at {bootstrap}: {error.strerror}\n"
                         "This system does not let unprivileged programs make namespaces; tell the program under test where "
                         "the socket is instead.\n")
        return 1
    os.fchdir(here)
    os.close(here)
    try:
        os.execvp(command[0], command)
    except OSError as error:
        sys.stderr.write(f"brenvik-mobile-helper-mock: {command[0]}: {error.strerror}\n")
        return 127 if isinstance(error, FileNotFoundError) else 126


if __name__ == "__main__":
    sys.exit(main(sys.argv[1:]))

# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""A journalled file system of the test's own: ext4 on a loop device, and a log of every block that was written to it.

The loop device's file is served by this process's child over FUSE. The kernel hands it each write of the block layer, and
a flush as fsync; the child keeps both in the order in which they came. From that log follows what a disk may hold after a
power cut: all that was written before the last flush, and any part of what was written since.
"""
import contextlib
import ctypes
import errno
import fcntl
import os
import pathlib
import multiprocessing
import select
import stat
import struct
import subprocess
import time
import traceback

BLOCK = 4096  # written whole or not at all; the block size of the file system
LOOP_SET_FD, LOOP_SET_STATUS64, LOOP_GET_FREE = 0x4C00, 0x4C04, 0x4C82
LOOP_AUTOCLEAR = 4
MS_NOSUID, MS_NODEV, MS_NOATIME, MS_BIND = 2, 4, 1024, 4096

libc = ctypes.CDLL(None, use_errno=True)


def is_available():
    """Whether this system has what the tests need."""
    return (os.path.exists("/dev/fuse") and "loop-control" in pathlib.Path("/proc/misc").read_text()
            and "ext4" in pathlib.Path("/proc/filesystems").read_text())


def mount(source, target, kind=None, flags=0, options=None):
    encoded = [None if each is None else os.fsencode(each) for each in (source, target, kind)]
    if libc.mount(*encoded, ctypes.c_ulong(flags), None if options is None else os.fsencode(options)) != 0:
        number = ctypes.get_errno()
        raise OSError(number, f"mount {source}: {os.strerror(number)}")


def unmount(target):
    """Waits for whoever still works there: workers leave a moment after their helper."""
    end = time.monotonic() + 20
    while libc.umount2(os.fsencode(target), 0) != 0:
        number = ctypes.get_errno()
        if number != errno.EBUSY or time.monotonic() > end:
            raise OSError(number, f"umount {target}: {os.strerror(number)}")
        time.sleep(0.005)


class LoopDevices:
    """Makes loop devices. They end with their last user."""

    def __init__(self):
        # The sandbox has none of these files, and its other folders allow no devices.
        self.folder = pathlib.Path("/tmp/devices")
        self.folder.mkdir()
        mount("devices", self.folder, "tmpfs", MS_NOSUID)
        os.mknod(self.folder / "control", 0o600 | stat.S_IFCHR, os.makedev(10, 237))

    @contextlib.contextmanager
    def on(self, file):
        """The path of a device on that file."""
        with contextlib.ExitStack() as stack:
            backing = os.open(file, os.O_RDWR | os.O_CLOEXEC)
            stack.callback(os.close, backing)
            path, device = self._take_free(backing)
            stack.callback(os.close, device)
            yield path

    def _take_free(self, backing):
        for _ in range(100):
            control = os.open(self.folder / "control", os.O_RDWR | os.O_CLOEXEC)
            try:
                number = fcntl.ioctl(control, LOOP_GET_FREE)
            finally:
                os.close(control)
            path = self.folder / f"loop{number}"
            if not path.exists():
                os.mknod(path, 0o600 | stat.S_IFBLK, os.makedev(7, number))
            device = os.open(path, os.O_RDWR | os.O_CLOEXEC)
            try:
                fcntl.ioctl(device, LOOP_SET_FD, backing)
            except OSError as error:  # others look for free ones, too
                os.close(device)
                if error.errno != errno.EBUSY:
                    raise
                continue
            status = bytearray(232)
            struct.pack_into("<I", status, 52, LOOP_AUTOCLEAR)
            fcntl.ioctl(device, LOOP_SET_STATUS64, bytes(status))
            return path, device
        raise OSError(errno.EBUSY, "no free loop device")


class Volume:
    """The file system mounted at its place, parts of it bound to where the helper works."""

    def __init__(self, loops, places):
        self.loops, self.places, self.mounted = loops, places, []
        self.place = pathlib.Path("/tmp/disk")
        self.place.mkdir(exist_ok=True)

    def mount(self, file):
        with self.loops.on(file) as device:
            mount(device, self.place, "ext4", MS_NODEV | MS_NOATIME, "errors=remount-ro")
        self.mounted = [self.place]
        for name, where in self.places.items():
            (self.place / name).mkdir(exist_ok=True)
            pathlib.Path(where).mkdir(parents=True, exist_ok=True)
            mount(self.place / name, where, flags=MS_BIND)
            self.mounted.append(where)

    def unmount(self):
        while self.mounted:
            unmount(self.mounted[-1])
            self.mounted.pop()

    def flush(self):
        folder = os.open(self.place, os.O_RDONLY | os.O_DIRECTORY | os.O_CLOEXEC)
        try:
            if libc.syncfs(folder) != 0:
                raise OSError(ctypes.get_errno(), "syncfs")
        finally:
            os.close(folder)


def make_image(path, megabytes=16):
    """An empty ext4 with a journal. Small, because every state after a power cut is a copy of it."""
    with open(path, "wb") as file:
        file.truncate(megabytes << 20)
    subprocess.run(["mkfs.ext4", "-q", "-b", str(BLOCK), "-J", "size=4", "-E", "lazy_itable_init=0,nodiscard",
                    "-O", "metadata_csum,64bit", "-I", "256", str(path)], check=True, stdout=subprocess.DEVNULL)


class BlockLog:
    """Serves an image as the file `disk` of a FUSE mount and keeps what is written to it."""

    def __init__(self, image):
        self.folder = pathlib.Path("/tmp/block-log")
        self.folder.mkdir(exist_ok=True)
        fuse = os.open("/dev/fuse", os.O_RDWR | os.O_CLOEXEC)
        mount("block-log", self.folder, "fuse", MS_NOSUID | MS_NODEV, f"fd={fuse},rootmode=40000,user_id=0,group_id=0")
        self.control, theirs = multiprocessing.Pipe()
        self.pid = os.fork()
        if self.pid == 0:
            status = 1
            try:
                self.control.close()
                Server(fuse, theirs, bytearray(pathlib.Path(image).read_bytes())).serve()
                status = 0
            except BaseException:
                traceback.print_exc()
            finally:
                os._exit(status)
        theirs.close()
        os.close(fuse)
        self.file = self.folder / "disk"

    def _ask(self, command):
        self.control.send(command)
        return self.control.recv()

    def start(self):
        """What is on the disk now is the beginning."""
        self._ask("start")

    def mark(self):
        """What was written until now was written before this moment."""
        self._ask("mark")

    def take(self):
        """The image at start() and the events since: (offset, bytes) of a write, "flush" or "mark"."""
        return self._ask("take")

    def close(self):
        unmount(self.folder)
        self.control.close()
        if os.waitpid(self.pid, 0)[1] != 0:
            raise AssertionError("the block log ended with an error")


class Server:
    """The part of the FUSE protocol that one file of a fixed size needs (linux/fuse.h)."""

    LOOKUP, FORGET, GETATTR, SETATTR, OPEN, READ, WRITE, STATFS, RELEASE, FSYNC, FLUSH, INIT, INTERRUPT, DESTROY, BATCH_FORGET = (
        1, 2, 3, 4, 14, 15, 16, 17, 18, 20, 25, 26, 36, 38, 42)
    MOST = 128 << 10  # bytes of a write

    def __init__(self, fuse, control, image):
        self.fuse, self.control, self.image = fuse, control, image
        self.base, self.events = bytes(image), []
        os.set_blocking(fuse, False)

    def serve(self):
        while True:
            select.select([self.fuse, self.control], [], [])
            # A command comes after all requests that were there before it.
            while True:
                try:
                    request = os.read(self.fuse, self.MOST + 4096)
                except BlockingIOError:
                    break
                except OSError as error:
                    if error.errno == errno.ENODEV:  # unmounted
                        return
                    if error.errno in (errno.ENOENT, errno.EINTR):  # interrupted
                        continue
                    raise
                self._answer(request)
            if self.control.poll():
                try:
                    command = self.control.recv()
                except EOFError:
                    return
                if command == "take":
                    self.control.send((self.base, self.events))
                    continue
                if command == "start":
                    self.base, self.events = bytes(self.image), []
                else:
                    self.events.append("mark")
                self.control.send(None)

    def _attributes(self, node):
        is_folder = node == 1
        return struct.pack("<6Q10I", node, 0 if is_folder else len(self.image), 0, 0, 0, 0, 0, 0, 0,
                           (stat.S_IFDIR | 0o700) if is_folder else (stat.S_IFREG | 0o600), 1, 0, 0, 0, BLOCK, 0)

    def _answer(self, request):
        _, kind, unique, node = struct.unpack_from("<IIQQ", request)
        body = memoryview(request)[40:]
        if kind in (self.FORGET, self.INTERRUPT, self.BATCH_FORGET):
            return
        error, answer = 0, b""
        if kind == self.INIT:
            answer = struct.pack("<IIIIHHIIHHI28x", 7, 31, 0, (1 << 5) | (1 << 22), 16, 12, self.MOST, 1,
                                 self.MOST // 4096, 0, 0)
        elif kind == self.LOOKUP:
            if bytes(body) == b"disk\0":
                answer = struct.pack("<QQQQII", 2, 0, 3600, 3600, 0, 0) + self._attributes(2)
            else:
                error = errno.ENOENT
        elif kind in (self.GETATTR, self.SETATTR):
            answer = struct.pack("<QII", 3600, 0, 0) + self._attributes(node)
        elif kind == self.OPEN:
            answer = struct.pack("<QIi", 0, 0, 0)
        elif kind == self.READ:
            _, offset, size = struct.unpack_from("<QQI", body)
            answer = bytes(self.image[offset:offset + size])
        elif kind == self.WRITE:
            _, offset, size = struct.unpack_from("<QQI", body)
            data = bytes(body[40:40 + size])
            self.image[offset:offset + size] = data
            self.events.append((offset, data))
            answer = struct.pack("<II", size, 0)
        elif kind == self.FSYNC:
            self.events.append("flush")
        elif kind == self.STATFS:
            answer = bytes(80)
        elif kind not in (self.RELEASE, self.FLUSH, self.DESTROY):
            error = errno.ENOSYS
        try:
            os.write(self.fuse, struct.pack("<IiQ", 16 + len(answer), -error, unique) + answer)
        except FileNotFoundError:  # nobody waits for it: interrupted, or unmounted meanwhile
            pass


def blocks(event):
    """A write, block by block: a disk may have some of it only."""
    offset, data = event
    while data:
        size = BLOCK - offset % BLOCK
        yield offset, data[:size]
        offset, data = offset + size, data[size:]


class Cut:
    """One state of the disk after a power cut."""

    def __init__(self, base, written, where, is_after_mark):
        self._base, self._written, self.where, self.is_after_mark = base, written, where, is_after_mark

    def image(self):
        image = bytearray(self._base)
        for offset, data in self._written:
            image[offset:offset + len(data)] = data
        return image


def cuts(base, events, generator, subsets):
    """What the disk may hold after a power cut at each event of the log: nothing of what was not flushed, all of it, and so
    many random subsets of its blocks. Each state once, before the mark and after it."""
    durable, pending, is_after_mark = [], [], False
    seen, found = set(), []
    for number, event in enumerate(["start", *events]):
        if event == "flush":
            durable, pending = durable + pending, []
        elif event == "mark":
            is_after_mark = True
        elif event != "start":
            pending.extend(blocks(event))
        everything = range(len(pending))
        choices = [("nothing", ()), ("all", tuple(everything))]
        choices += [(f"subset {each}", tuple(i for i in everything if generator.random() < 0.5)) for each in range(subsets)]
        for name, chosen in choices:
            whole = len(chosen) == len(pending)
            key = (is_after_mark, len(durable) + len(chosen) if whole else len(durable), () if whole else chosen)
            if key not in seen:
                seen.add(key)
                found.append(Cut(base, durable + [pending[i] for i in chosen],
                                 f"event {number} of {len(events)}, {name} of {len(pending)} blocks that were not flushed",
                                 is_after_mark))
    return found

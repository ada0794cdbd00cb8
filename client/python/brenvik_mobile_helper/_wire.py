# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Messages: how requests are laid out, and what is believed of replies. No waiting here; all clients share it."""
import fcntl
import os
import socket
import struct
from array import array

from ._errors import InvalidArgumentError, ProtocolError, answered
from ._table import (ALIGNMENT, CHECK_IN_DISPOSITION, CHECK_IN_REPLY_DISPOSITION, COMPLEX, COPY, DESCRIPTORS, LARGEST, NDR,
                     OUT_OF_LINE, PORT, REPLY_DISPOSITION, REPLY_ID, REPLY_SIZES, CHECK_IN, Routine)

HEADER = struct.Struct("<IIIIIi")
REGION = struct.Struct("<QBBBBI")
PORT_DESCRIPTOR = struct.Struct("<IIHBB")
_CODE = struct.Struct("<i")
SIMPLE_BITS = REPLY_DISPOSITION
COMPLEX_BITS = COMPLEX | REPLY_DISPOSITION
STATUS_SIZE = REPLY_SIZES["status"]
REGION_SIZE = REPLY_SIZES["region"]
# Room for more rights than any message carries, so that too many are told from a cut message.
ROOM_FOR_RIGHTS = socket.CMSG_SPACE(4 * 4)
_SEALS = fcntl.F_SEAL_SHRINK | fcntl.F_SEAL_GROW | fcntl.F_SEAL_WRITE
# No helper may claim the transport's own codes.
_OWN_CODES = range(-7099, -7000)

# An id that nobody knows is the cheapest question.
NOTHING = Routine(0, "", 24, 0, (), "status")


# ---- arguments ----

def text(value, size: int, name: str) -> bytes:
    """A text for a field of that size, which its NUL must fit, too."""
    if not isinstance(value, str):
        try:
            value = os.fspath(value)
        except TypeError:
            raise InvalidArgumentError(f"{name} must be a text, not {type(value).__name__}") from None
        if isinstance(value, bytes):
            value = os.fsdecode(value)
    try:
        raw = value.encode()
    except UnicodeEncodeError:
        raise InvalidArgumentError(f"{name} is not valid Unicode") from None
    if len(raw) >= size:
        raise InvalidArgumentError(f"{name} has {len(raw)} bytes, at most {size - 1} fit")
    if b"\0" in raw:
        raise InvalidArgumentError(f"{name} holds a NUL")
    return raw


def integer(value, name: str) -> int:
    """A number for a field of 32 bits with a sign."""
    try:
        number = value.__index__()
    except AttributeError:
        raise InvalidArgumentError(f"{name} must be an integer, not {type(value).__name__}") from None
    if not -0x80000000 <= number <= 0x7FFFFFFF:
        raise InvalidArgumentError(f"{name} does not fit 32 bits: {number}")
    return number


def real(value, name: str) -> float:
    try:
        return float(value)
    except (TypeError, ValueError, OverflowError):
        raise InvalidArgumentError(f"{name} must be a number: {value!r}") from None


def serialized(value, name: str) -> bytes:
    """A value as a property list: XML, which the helper makes of it anyway, and which has no way to write None."""
    import plistlib  # half of what importing the package would cost
    try:
        return plistlib.dumps(value, fmt=plistlib.FMT_XML)
    except (TypeError, ValueError, OverflowError, RecursionError, AttributeError) as error:
        raise InvalidArgumentError(f"{name} cannot be a property list: {error}") from error


def preference(value, name: str) -> bytes:
    """A preference value; None stands for its removal, which on the wire is a value of one byte."""
    return b"\0" if value is None else serialized(value, name)


def parsed(region: bytes | None):
    """The value of a region that the helper returned; None where there is no value."""
    if region is None:
        return None
    import plistlib
    try:
        return plistlib.loads(region)
    except Exception as error:  # the parser of XML and plistlib have many of their own
        raise ProtocolError(detail=f"the region is no property list: {error}") from error


def pack(routine: Routine, arguments: dict) -> tuple[bytes, list[bytes]]:
    """The message behind its header (of a complex one, behind its descriptors), and the regions, from arguments by name."""
    given = dict(arguments)
    parts, regions = [NDR] if routine.arguments else [], []
    lengths: dict[str, int] = {}
    for each in routine.arguments:
        if each.type not in ("text", "i32", "f64", "region"):
            if each.type == "regionSize":
                parts.append(struct.pack("<I", lengths[each.region]))
            continue
        if each.name not in given:
            raise InvalidArgumentError(f"{routine.name} needs {each.name}")
        value = given.pop(each.name)
        if each.type == "text":
            parts.append(text(value, each.size, each.name).ljust(each.size, b"\0"))
        elif each.type == "i32":
            parts.append(struct.pack("<i", integer(value, each.name)))
        elif each.type == "f64":
            parts.append(struct.pack("<d", real(value, each.name)))
        else:
            if not isinstance(value, (bytes, bytearray, memoryview)):
                raise InvalidArgumentError(f"{each.name} must be bytes, not {type(value).__name__}")
            regions.append(bytes(value))
            lengths[each.name] = len(regions[-1])
    if given:
        raise InvalidArgumentError(f"{routine.name} has no {', '.join(given)}")
    return b"".join(parts), regions


# ---- regions ----

def sealed_memory(data: bytes) -> int:
    """A descriptor of memory that nobody can change any more."""
    memory = os.memfd_create("brenvik-region", os.MFD_CLOEXEC | os.MFD_ALLOW_SEALING)
    try:
        left = memoryview(data)
        while left:
            left = left[os.write(memory, left):]
        fcntl.fcntl(memory, fcntl.F_ADD_SEALS, _SEALS | fcntl.F_SEAL_SEAL)
    except BaseException:
        os.close(memory)
        raise
    return memory


def close_all(descriptors) -> None:
    for each in descriptors:
        os.close(each)


def with_regions(size: int, rest: bytes, regions, deallocate: int = 0) -> tuple[bytes, list[int]]:
    """All of a complex message of that size behind its header, and the descriptors to send with it.

    Regions follow the message at multiples of 8 while they fit the datagram; the rest go into sealed memory. The caller
    closes the descriptors.
    """
    parts, tail, end, memories = [struct.pack("<I", len(regions))], [], size, []
    try:
        for each in regions:
            length, address = len(each), 0
            start = -(-end // ALIGNMENT) * ALIGNMENT
            if start + length > LARGEST:
                memories.append(sealed_memory(each))
            elif length:
                address = start
                tail += [bytes(start - end), each]
                end = start + length
            parts.append(REGION.pack(address, deallocate, COPY, 0, OUT_OF_LINE, length))
    except BaseException:
        close_all(memories)
        raise
    return b"".join([*parts, rest, *tail]), memories


def region_in(data: bytes, size: int, offset: int, descriptors, is_cut: bool) -> bytes | None:
    """The one region of a message whose fixed part has that size; None when it is empty. ValueError when it is not as it
    should be."""
    if is_cut:
        raise ValueError("the message is cut")
    address, _, _, _, kind, length = REGION.unpack_from(data, offset)
    if kind != OUT_OF_LINE:
        raise ValueError("a descriptor of another kind")
    if length == 0 or address == 0:
        if len(descriptors) != (1 if length else 0):
            raise ValueError("more or fewer descriptors than the message says")
        if len(data) != size:
            raise ValueError("bytes behind the message")
        return _read_sealed(descriptors[0], length) if length else None
    start = -(-size // ALIGNMENT) * ALIGNMENT
    if descriptors or address != start or len(data) - start != length or HEADER.unpack_from(data)[1] != size:
        raise ValueError("the region is not where it should be")
    return data[start:]


def _read_sealed(memory: int, length: int) -> bytes:
    try:
        seals = fcntl.fcntl(memory, fcntl.F_GET_SEALS)
    except OSError:
        seals = 0
    if seals & _SEALS != _SEALS:
        raise ValueError("the memory is not sealed")
    if os.fstat(memory).st_size < length:
        raise ValueError("the memory is shorter than the message says")
    data = os.pread(memory, length, 0)
    while len(data) < length:
        more = os.pread(memory, length - len(data), len(data))
        if not more:
            raise ValueError("the memory cannot be read")
        data += more
    return data


# ---- requests, as they arrive ----

class WrongDescriptor(ValueError):
    """A descriptor of another kind, or whose size is not the one in the body."""


def unpack(routine: Routine, data: bytes, descriptors: list[int]) -> dict:
    """The arguments of a request by name, the opposite of pack(). ValueError when it is malformed."""
    at, memories, regions = routine.request_size, list(descriptors), {}
    if routine.descriptors and struct.unpack_from("<I", data.ljust(28, b"\0"), 24)[0] != routine.descriptors:
        raise ValueError("another number of descriptors")
    if len(data) < routine.request_size:
        raise ValueError("the message is too short")
    for each in routine.arguments:
        if each.type != "region":
            continue
        address, _, _, _, kind, length = REGION.unpack_from(data, each.offset)
        if kind != OUT_OF_LINE:
            raise WrongDescriptor("a descriptor of another kind")
        if length == 0:
            regions[each.name] = b""
        elif address == 0:
            if not memories:
                raise ValueError("fewer descriptors than the message says")
            regions[each.name] = _read_sealed(memories.pop(0), length)
        else:
            start = -(-at // ALIGNMENT) * ALIGNMENT
            if address != start or start + length > len(data):
                raise ValueError("the region is not where it should be")
            regions[each.name] = data[start:start + length]
            at = start + length
    if memories or len(data) != at:
        raise ValueError("more came than the message says")
    arguments: dict = {}
    for each in routine.arguments:
        field = data[each.offset:each.offset + each.size]
        if each.type == "text":
            arguments[each.name] = field.partition(b"\0")[0].decode("utf-8", "surrogateescape")
        elif each.type == "i32":
            arguments[each.name], = struct.unpack("<i", field)
        elif each.type == "f64":
            arguments[each.name], = struct.unpack("<d", field)
        elif each.type == "region":
            arguments[each.name] = regions[each.name]
        elif each.type == "regionSize" and struct.unpack("<I", field)[0] != len(regions[each.region]):
            raise WrongDescriptor("a region's two sizes differ")
    return arguments


# ---- replies ----

def rights_in(ancillary) -> list[int]:
    """The descriptors that came with a message. They are the caller's to close."""
    descriptors = array("i")
    for level, kind, data in ancillary:
        if level == socket.SOL_SOCKET and kind == socket.SCM_RIGHTS:
            descriptors.frombytes(data[:len(data) - len(data) % 4])
    return list(descriptors)


def is_channel(descriptor: int) -> bool:
    sock = None
    try:
        sock = socket.socket(fileno=os.dup(descriptor))
        return sock.family == socket.AF_UNIX and sock.type == socket.SOCK_SEQPACKET
    except OSError:
        return False
    finally:
        if sock is not None:
            sock.close()


def read_reply(routine: Routine, data: bytes, descriptors: list[int] | None = None, is_cut: bool = False):
    """What a reply holds: None, a bool, a text, or the bytes of a region (None: no value).

    HelperError for a code other than 0, ProtocolError for anything a correct helper does not send. A check-in's reply
    leaves its channel in `descriptors`; the caller closes whatever came.
    """
    size = len(data)
    if is_cut or size < 24:
        raise ProtocolError(detail="the answer is cut")
    bits, _, remote, _, _, message_id = HEADER.unpack_from(data)
    if message_id != routine.id + REPLY_ID or remote:
        raise ProtocolError(detail="the answer is to something else")
    form = routine.reply
    if bits & COMPLEX:
        return _read_complex(form, data, descriptors or [])
    if descriptors or size < STATUS_SIZE:
        raise ProtocolError(detail="the answer has another form")
    code, = _CODE.unpack_from(data, 32)
    if code:
        if size != STATUS_SIZE or code in _OWN_CODES:
            raise ProtocolError(detail="a failure has another form")
        raise answered(code)
    if form == "region" or form == "check-in" or size != REPLY_SIZES[form]:
        raise ProtocolError(detail="the answer has another form")
    if form == "status":
        return None
    if form == "boolean":
        return data[36] != 0
    # The texts are the helper's, which makes them of UTF-8; a broken store may not be.
    return data[36:].partition(b"\0")[0].decode("utf-8", "replace")


def _read_complex(form, data, descriptors):
    if form == "region":
        if len(data) < REGION_SIZE or data[24:28] != b"\1\0\0\0" or data[40:44] != data[52:56]:
            raise ProtocolError(detail="the region's descriptor is not as it should be")
        try:
            return region_in(data, REGION_SIZE, DESCRIPTORS, descriptors, False)
        except ValueError as error:
            raise ProtocolError(detail=str(error)) from None
    if form != "check-in" or len(data) != REPLY_SIZES["check-in"] or data[24:28] != b"\1\0\0\0" or len(descriptors) != 1:
        raise ProtocolError(detail="the answer has another form")
    _, _, _, disposition, kind = PORT_DESCRIPTOR.unpack_from(data, DESCRIPTORS)
    if kind != PORT or disposition != CHECK_IN_REPLY_DISPOSITION or not is_channel(descriptors[0]):
        raise ProtocolError(detail="the channel's descriptor is not as it should be")
    return None


def check_in_message(port: int) -> bytes:
    return HEADER.pack(COMPLEX_BITS, CHECK_IN.request_size, port, 0, 0, CHECK_IN.id) + struct.pack("<I", 1) + PORT_DESCRIPTOR.pack(
        0, 0, 0, CHECK_IN_DISPOSITION, PORT)


def status_reply(message_id: int, port: int, code: int, result: bytes = b"") -> bytes:
    """A simple reply to a request with that id and reply port."""
    return HEADER.pack(SIMPLE_BITS, STATUS_SIZE + len(result), 0, port, 0, message_id + REPLY_ID) + NDR + _CODE.pack(
        code) + result

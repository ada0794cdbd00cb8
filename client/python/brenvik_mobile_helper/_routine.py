# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""A row of the protocol's table."""


class Argument:
    """A field of a request: its name, where it stands, and its type as the table has it."""

    __slots__ = ("name", "offset", "size", "type", "region")

    def __init__(self, name: str, offset: int, size: int, type: str, region: str = ""):
        self.name, self.offset, self.size, self.type, self.region = name, offset, size, type, region


class Routine:
    """What a request and its reply look like."""

    __slots__ = ("id", "name", "request_size", "descriptors", "arguments", "reply")

    def __init__(self, id: int, name: str, request_size: int, descriptors: int, arguments: tuple[Argument, ...], reply: str):
        self.id, self.name, self.request_size = id, name, request_size
        self.descriptors, self.arguments, self.reply = descriptors, arguments, reply

    @property
    def parameters(self) -> list[Argument]:
        """The arguments that a caller gives, without counts and sizes."""
        return [each for each in self.arguments if each.type in ("text", "i32", "f64", "region")]

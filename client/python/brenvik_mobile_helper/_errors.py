# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""What can go wrong, as exceptions. Codes are the same as in the C library's header."""
from ._table import CODES

_OWN = {
    -7020: "the service's socket file is gone",
    -7012: "the service manager handed over no such socket",
    -7011: "the sender no longer waits for an answer",
    -7010: "another process serves that name",
    -7009: "a system call failed",
    -7008: "the answer breaks the protocol",
    -7007: "the helper left without answering; the request may have been carried out",
    -7006: "the helper left before it took the request",
    -7005: "no answer in time",
    -7004: "no helper answers at its socket",
    -7003: "not connected to the helper",
    -7001: "an argument is missing or does not fit",
}


def error_text(code: int) -> str:
    """What a code means, in English, without a full stop."""
    return CODES.get(code) or _OWN.get(code) or "the helper answered with a code of its system"


class Error(Exception):
    """Any failure of this package. `code` is the helper's, or one from -7099 to -7001 for the transport's own."""

    code = 0

    def __init__(self, code: int | None = None, detail: str = ""):
        if code is not None:
            self.code = code
        text = error_text(self.code)
        super().__init__(f"{text}: {detail}" if detail else text)


class HelperError(Error):
    """The helper answered with a code other than 0."""

    def __init__(self, code: int, detail: str = ""):
        super().__init__(code, detail or f"code {code}")


class RefusedError(HelperError):
    """This program lacks the entitlement, or its account may not even connect (then `__cause__` is set)."""

    def __init__(self, code: int = 35, detail: str = ""):
        super().__init__(code, detail)


class NoAccessError(HelperError):
    """The path is outside the places that the routine may touch."""


class TransportError(Error):
    """The request did not get through, or its answer did not."""


class InvalidArgumentError(TransportError, ValueError):
    """An argument does not fit its field. Nothing was sent."""

    code = -7001

    def __init__(self, detail: str):
        super().__init__(detail=detail)


class NotConnectedError(TransportError):
    """The client was closed. Nothing was sent."""

    code = -7003


class UnreachableError(TransportError):
    """Nobody answers at the helper's socket; `__cause__` has the reason."""

    code = -7004


class TimedOutError(TransportError, TimeoutError):
    """No answer in time. What was sent may still be carried out. The client can be used on."""

    code = -7005


class HelperGoneError(TransportError):
    """The helper left before it took the request. It was not carried out."""

    code = -7006


class AnswerLostError(TransportError):
    """The helper left without answering. The request may have been carried out."""

    code = -7007


class ProtocolError(TransportError):
    """The answer breaks the protocol. The channel was closed; the next call opens another."""

    code = -7008


class NameInUseError(TransportError):
    """Another live process listens under that name."""

    code = -7010


class NoLongerThereError(TransportError):
    """The sender of the push no longer waits for its answer."""

    code = -7011


class NotHandedOverError(TransportError):
    """The service manager gave this process no such socket."""

    code = -7012


class NameLostError(TransportError):
    """Somebody removed a socket file that the listener made, or its folder. Nobody can connect to it any more."""

    code = -7020


def answered(code: int) -> HelperError:
    """The exception for a code that the helper answered."""
    return {35: RefusedError, 8: NoAccessError}.get(code, HelperError)(code)

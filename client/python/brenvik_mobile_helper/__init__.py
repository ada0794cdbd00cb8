# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Client of BrenvikMobileHelper: call its routines, receive its pushes and notifications.

    from brenvik_mobile_helper import Client

    with Client() as helper:
        print(helper.copy_country_code())

AsyncClient and AsyncListener are the same for asyncio. docs/python.md of the project has more.
"""
from ._build import VERSION as __version__
from ._client import Client, service_socket
from ._errors import (AnswerLostError, Error, HelperError, HelperGoneError, InvalidArgumentError, NameInUseError,
                      NameLostError, NoAccessError, NoLongerThereError, NotConnectedError, NotHandedOverError, ProtocolError, RefusedError,
                      TimedOutError, TransportError, UnreachableError, error_text)
from ._table import LASD_BITS as DATABASES

TYPE_CHECKING = False
if TYPE_CHECKING:
    from ._listener import CivicInfo, Event, Listener, LocalAddress, Notification
    from .aio import AsyncClient, AsyncListener

__all__ = [
    "AnswerLostError", "AsyncClient", "AsyncListener", "CivicInfo", "Client", "DATABASES", "Error", "Event", "HelperError",
    "HelperGoneError", "InvalidArgumentError", "Listener", "LocalAddress", "NameInUseError", "NameLostError", "NoAccessError",
    "NoLongerThereError", "NotConnectedError", "NotHandedOverError", "Notification", "ProtocolError", "RefusedError",
    "TimedOutError", "TransportError", "UnreachableError", "error_text", "service_socket"]

_LATER = dict.fromkeys(("CivicInfo", "Event", "Listener", "LocalAddress", "Notification"), "._listener") | dict.fromkeys(
    ("AsyncClient", "AsyncListener"), ".aio")


def __getattr__(name: str):
    # What a program does not use, it need not wait for.
    if name in _LATER:
        from importlib import import_module
        value = globals()[name] = getattr(import_module(_LATER[name], __name__), name)
        return value
    raise AttributeError(f"module {__name__!r} has no attribute {name!r}")


def __dir__():
    return sorted({*globals(), *__all__})

#!/usr/bin/python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The smallest telephony daemon in Python: takes over the sockets that the service manager made, asks where the phone is, and
prints what it is told. Units, account and entitlement file are those of ../brenvikd; its executable is /usr/bin/python3."""
import asyncio
import sys

from brenvik_mobile_helper import AsyncClient, AsyncListener, CivicInfo, Error, LocalAddress, Notification


async def main() -> None:
    # The client stays open, because the helper leaves ten seconds after its last client.
    async with AsyncListener.from_environment() as listener, AsyncClient() as helper:
        # The question returns at once; its answer is a push.
        await helper.request_country_code_from_location(59.9139, 10.7522)
        async for event in listener:
            match event:
                case CivicInfo():
                    print(f'country "{event.country_code}", city "{event.city}"', flush=True)
                case LocalAddress():
                    print(f'address "{event.address}"', flush=True)
                case Notification():
                    print(f'notification "{event.kind}" {event.database}', flush=True)


try:
    asyncio.run(main())
except Error as error:
    sys.exit(f"brenvikd: {error}")

#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""A stand-in for ModemManager on the system bus, by sd-bus: it knows as many modems as it is told, and takes SetLogging.

usage: modem_manager.py MODEMS; prints a line when it is ready, and one for each method that is called.
"""
import ctypes
import sys

NAME = b"org.freedesktop.ModemManager1"
LIBRARY = ctypes.CDLL("libsystemd.so.0")
LIBRARY.sd_bus_message_get_member.restype = ctypes.c_char_p
HANDLER = ctypes.CFUNCTYPE(ctypes.c_int, ctypes.c_void_p, ctypes.c_void_p, ctypes.c_void_p)


def check(result):
    if result < 0:
        sys.exit(f"sd-bus: error {-result}")
    return result


def main(modems):
    bus = ctypes.c_void_p()
    check(LIBRARY.sd_bus_open_system(ctypes.byref(bus)))

    @HANDLER
    def called(message, _data, _error):
        message = ctypes.c_void_p(message)
        kind = ctypes.c_uint8()
        check(LIBRARY.sd_bus_message_get_type(message, ctypes.byref(kind)))
        if kind.value != 1:  # no method call
            return 0
        member = LIBRARY.sd_bus_message_get_member(message)
        reply = ctypes.c_void_p()
        check(LIBRARY.sd_bus_message_new_method_return(message, ctypes.byref(reply)))
        if member == b"GetManagedObjects":
            check(LIBRARY.sd_bus_message_open_container(reply, ctypes.c_char(b"a"), b"{oa{sa{sv}}}"))
            for number in range(modems):
                path = f"/org/freedesktop/ModemManager1/Modem/{number}".encode()
                check(LIBRARY.sd_bus_message_append(reply, b"{oa{sa{sv}}}", path, ctypes.c_uint(0)))
            check(LIBRARY.sd_bus_message_close_container(reply))
        check(LIBRARY.sd_bus_send(bus, reply, None))
        LIBRARY.sd_bus_message_unref(reply)
        print(member.decode(), flush=True)
        return 1
    check(LIBRARY.sd_bus_add_filter(bus, None, called, None))
    check(LIBRARY.sd_bus_request_name(bus, NAME, ctypes.c_uint64(0)))
    print("ready", flush=True)
    while True:
        if check(LIBRARY.sd_bus_process(bus, None)) == 0:
            check(LIBRARY.sd_bus_wait(bus, ctypes.c_uint64(2**64 - 1)))


if __name__ == "__main__":
    main(int(sys.argv[1]))

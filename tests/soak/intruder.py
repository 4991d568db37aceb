"""What programs do to the daemon's socket that speak its protocol wrongly or not at all."""

import os
import random
import socket
import time

OTHER_USERS = (54321, 54322)


def become_another(which=0):
    """In a child: another user, where that is possible."""
    if os.geteuid() == 0:
        os.setgroups([])
        os.setgid(OTHER_USERS[which])
        os.setuid(OTHER_USERS[which])


def intrude(path, seed, seconds):
    """What a program that means harm, or is broken, does with the socket."""
    draw = random.Random(seed)
    end = time.monotonic() + seconds
    user = str(os.getuid()).encode().hex().encode()
    introspect = make_call(b"Introspect", b"org.freedesktop.DBus.Introspectable")
    held = []
    while time.monotonic() < end:
        connection = socket.socket(socket.AF_UNIX)
        connection.settimeout(1)
        try:
            connection.connect(path)
            choice = draw.randrange(8)
            if choice == 0:
                connection.send(draw.randbytes(draw.randrange(1, 4000)))
            elif choice == 1:
                connection.send(b"\0AUTH EXTERNAL " + user[: draw.randrange(4)])
                held.append(connection)
            else:
                connection.send(b"\0AUTH EXTERNAL " + user + b"\r\nNEGOTIATE_UNIX_FD\r\nBEGIN\r\n")
            if choice == 2:  # asks much and reads nothing
                connection.send(introspect * draw.randrange(1, 900))
                held.append(connection)
            elif choice == 3:  # descriptors in a message of which the rest never comes
                with open("/dev/null") as null:
                    socket.send_fds(connection, [introspect[:20]], [null.fileno()] * 16)
                held.append(connection)
            elif choice == 4:  # a message, one byte of it wrong
                spoilt = bytearray(introspect)
                spoilt[draw.randrange(len(spoilt))] = draw.randrange(256)
                connection.send(bytes(spoilt) * draw.randrange(1, 20))
            elif choice == 5:
                connection.send(introspect[: draw.randrange(len(introspect))])
                held.append(connection)
            elif choice == 6:
                connection.send(introspect + make_call(b"FinishSession"))
            if len(held) > 200:
                held.pop(draw.randrange(len(held))).close()
        except OSError:
            pass
        time.sleep(draw.uniform(0, 0.02))


def make_call(member, interface=b"com.vantu.kytreportingd.ClientSessionInterface"):
    """A D-Bus method call without arguments, little-endian."""

    def field(code, kind, value):
        data = bytes([code, 1]) + kind + b"\0" + len(value).to_bytes(4, "little") + value + b"\0"
        return data + b"\0" * (-len(data) % 8)

    fields = field(1, b"o", b"/com/vantu/kytreportingd") + field(2, b"s", interface)
    last = bytes([3, 1]) + b"s\0" + len(member).to_bytes(4, "little") + member + b"\0"
    size = len(fields) + len(last)
    head = b"l\x01\0\x01" + (0).to_bytes(4, "little") + (7).to_bytes(4, "little") + size.to_bytes(4, "little")
    return head + fields + last + b"\0" * (-size % 8)

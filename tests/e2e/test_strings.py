"""Strings holding Unicode noncharacters, which D-Bus allows, go through like any other."""

import os
import socket
import struct
import sys
import unittest

import dbus

sys.path.insert(0, os.path.dirname(__file__))
from harness import BUS_NAME, DaemonTestCase, INTERFACE, OBJECT_PATH, wait_until  # noqa: E402

GENERIC = "com.korvane.qvsound.Generic.Generic"
NONCHARACTERS = ["\uffff", "\ufdd0", "\U0001fffe", "\U0010ffff"]


def pad(data, to):
    return data + b"\0" * (-len(data) % to)


def string(data, text):
    return pad(data, 4) + struct.pack("<I", len(text)) + text + b"\0"


def signature(data, text):
    return data + bytes([len(text)]) + text + b"\0"


def message(serial, fields, body_signature, body):
    """A little-endian method call; fields are (code, type, bytes) with type "s" or "o"."""
    out = b""
    for code, type_, value in fields:
        out = string(pad(out, 8) + bytes([code, 1]) + type_.encode() + b"\0", value)
    if body_signature:
        out = signature(pad(out, 8) + b"\x08\x01g\0", body_signature)
    header = b"l\1\0\1" + struct.pack("<III", len(body), serial, len(out)) + out
    return pad(header, 8) + body


def send_message_body(key, text, category, type_, rid):
    """SendMessage's a{sv}uqax holding {key: text}, key and text as raw bytes."""
    entries = string(signature(string(b"", key), b"s"), text)  # starts 8-aligned
    body = pad(struct.pack("<I", len(entries)), 8) + entries
    body = pad(body, 4) + struct.pack("<IH", category, type_)
    return pad(pad(body, 4) + struct.pack("<I", 8), 8) + struct.pack("<q", rid)


def raw_send(address, body):
    """Sends SendMessage written byte by byte, as no binding would write it; true when the bus
    kept the connection open (it closes it on a message it finds invalid)."""
    path = address.split("unix:path=", 1)[1].split(",")[0]
    with socket.socket(socket.AF_UNIX, socket.SOCK_STREAM) as s:
        s.settimeout(30)
        s.connect(path)
        uid = str(os.getuid()).encode().hex().encode()
        s.sendall(b"\0AUTH EXTERNAL " + uid + b"\r\nBEGIN\r\n")
        bus = [(1, "o", b"/org/freedesktop/DBus"), (2, "s", b"org.freedesktop.DBus"),
               (3, "s", b"Hello"), (6, "s", b"org.freedesktop.DBus")]
        call = [(1, "o", OBJECT_PATH.encode()), (2, "s", INTERFACE.encode()),
                (3, "s", b"SendMessage"), (6, "s", BUS_NAME.encode())]
        s.sendall(message(1, bus, b"", b"") + message(2, call, b"a{sv}uqax", body))
        # Then a Ping to the bus, which handles one connection's messages in order: its answer
        # means the call went through; a hang-up means the bus refused the call, and may come
        # before the Ping is even written.
        ping = [(1, "o", b"/org/freedesktop/DBus"), (2, "s", b"org.freedesktop.DBus.Peer"),
                (3, "s", b"Ping"), (6, "s", b"org.freedesktop.DBus")]
        received = b""

        def take(n):
            nonlocal received
            while len(received) < n:
                chunk = s.recv(4096)
                if not chunk:
                    raise ConnectionResetError
                received += chunk
            out, received = received[:n], received[n:]
            return out

        try:
            s.sendall(message(3, ping, b"", b""))
            while b"\r\n" not in received:  # the bus's "OK <guid>" line comes first
                chunk = s.recv(4096)
                if not chunk:
                    return False
                received += chunk
            received = received.split(b"\r\n", 1)[1]
            while True:
                head = take(16)
                body_length, _, fields_length = struct.unpack("<III", head[4:16])
                fields = take(fields_length + (-(16 + fields_length) % 8) + body_length)
                # A reply (type 2) whose REPLY_SERIAL field (5, "u"; fields start 8-aligned) is 3.
                for at in range(0, fields_length - 7, 8):
                    if (head[1] == 2 and fields[at:at + 4] == b"\x05\x01u\x00" and
                            struct.unpack("<I", fields[at + 4:at + 8])[0] == 3):
                        return True
        except (BrokenPipeError, ConnectionResetError):
            return False


class Noncharacters(DaemonTestCase):
    def test_noncharacters_in_keys_and_values_reach_the_sink_as_sent(self):
        c = self.client()
        c.create(7)
        c.start(7)
        sent = []
        for i, ch in enumerate(NONCHARACTERS):
            payload = {
                f"value{i}": f"a{ch}b",
                f"key{ch}{i}": dbus.Int64(i),
                f"nested{i}": dbus.Dictionary(
                    {f"in{ch}": dbus.Array([f"{ch}", dbus.Dictionary({ch: ch}, signature="sv")],
                                           signature="v")}, signature="sv"),
            }
            c.send(payload, 1, 0, [7])
            sent.append(payload)
        # SetConfiguration reads its reporter ID after such a payload too.
        self.assertTrue(c.reporting.SetConfiguration(
            dbus.Dictionary({"KXHostApplicationDisplayID": "\U0010ffff"}, signature="sv"),
            dbus.Int64(7)))
        lines = wait_until(lambda: len(self.daemon.events(GENERIC)) >= len(sent) and
                           self.daemon.events(GENERIC), timeout=30, what="every message written")
        for i, (line, payload) in enumerate(zip(lines, sent)):
            ch = NONCHARACTERS[i]
            got = line["payload"]
            self.assertEqual(got[f"value{i}"], f"a{ch}b")
            self.assertEqual(got[f"key{ch}{i}"], i)
            self.assertEqual(got[f"nested{i}"], {f"in{ch}": [ch, {ch: ch}]})
        stats = c.stats.GetStats()
        self.assertEqual((stats["limits_exceeded"], stats["input_refused"]), (0, 0))

    def test_invalid_utf8_is_still_refused(self):
        c = self.client()
        c.create(9)
        c.start(9)
        # Written by hand, a noncharacter gets through; the same call with a byte that is not
        # UTF-8 does not (the bus itself hangs up on the sender).
        self.assertTrue(raw_send(self.bus.address,
                                 send_message_body(b"raw", "x\uffff".encode(), 1, 0, 9)))
        self.assertFalse(raw_send(self.bus.address, send_message_body(b"raw", b"x\xff", 1, 0, 9)))
        self.assertFalse(raw_send(self.bus.address,
                                  send_message_body(b"raw\xc0\x80", b"x", 1, 0, 9)))
        c.send({"after": "plain"}, 1, 0, [9])
        lines = wait_until(lambda: len(self.daemon.events(GENERIC)) >= 2 and
                           self.daemon.events(GENERIC), timeout=30, what="the two good messages")
        # Two connections: the daemon keeps each one's order, not an order between them.
        self.assertCountEqual([(l["payload"].get("raw"), l["payload"].get("after")) for l in lines],
                              [("x\uffff", None), (None, "plain")])


if __name__ == "__main__":
    unittest.main()

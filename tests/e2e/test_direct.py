"""qvreportd's direct socket: the bus's interface on peer-to-peer connections, one client each."""

import os
import socket
import stat
import struct
import subprocess
import sys
import time
import unittest

import dbus

sys.path.insert(0, os.path.dirname(__file__))
from harness import Daemon, DaemonTestCase, DirectClient, OBJECT_PATH, INTERFACE, wait_until  # noqa: E402

PLAYBACK, START, STOP = 4, 1, 2
TEST_SERVICE = 11
LIMITS = "org.freedesktop.DBus.Error.LimitsExceeded"


def method_call(serial, path, interface, member):
    """A method call without arguments as it travels (little-endian D-Bus wire format)."""
    def pad(data, to):
        return data + b"\0" * (-len(data) % to)
    fields = b""
    for code, value in ((1, path), (2, interface), (3, member)):
        text = value.encode()
        fields = pad(fields, 8) + bytes([code, 1]) + (b"o" if code == 1 else b"s") + b"\0"
        fields += struct.pack("<I", len(text)) + text + b"\0"
    return pad(b"l\x01\x00\x01" + struct.pack("<III", 0, serial, len(fields)) + fields, 8)


def outcome(call):
    """What a call answers: its value, or its error's name and message."""
    try:
        return ("ok", call())
    except dbus.exceptions.DBusException as e:
        return ("error", e.get_dbus_name(), e.get_dbus_message())


class DirectSocket(DaemonTestCase):
    daemon_args = ("--max-payload-depth", "3", "--max-reporter-ids", "2")

    def test_every_call_answers_over_the_socket_as_over_the_bus_limits_and_errors_included(self):
        mode = stat.S_IMODE(os.stat(self.direct_socket).st_mode)
        self.assertEqual(mode, 0o666)
        clients = [(self.client(), 100), (self.direct_client(), 200)]
        for client, rid in clients:
            r = client.reporting
            deep = {"a": dbus.Dictionary({"b": dbus.Dictionary({"c": dbus.Dictionary(
                {"d": 1}, signature="sv")}, signature="sv")}, signature="sv")}
            answers = [
                outcome(lambda: r.CreateReportingSession(dbus.Int64(rid))),
                outcome(lambda: r.SetServiceType(dbus.UInt16(3), dbus.Int64(rid))),
                outcome(lambda: r.GetServiceNameForReporterID(dbus.Int64(rid))),
                outcome(lambda: r.GetServiceNameForReporterID(dbus.Int64(rid + 1))),
                outcome(lambda: r.SetConfiguration(dbus.Dictionary({"k": "v"}, signature="sv"),
                                                   dbus.Int64(rid))),
                outcome(lambda: r.SetConfiguration(dbus.Dictionary(deep, signature="sv"),
                                                   dbus.Int64(rid))),
                outcome(lambda: client.send({"x": 1}, 1, 0, [rid, rid + 1, rid + 2])),
                outcome(lambda: r.SetServiceType(dbus.Int64(3), dbus.Int64(rid))),  # wrong type
                outcome(lambda: {k: int(v) - (rid if k == "reporterID" else 0) for k, v in
                                 r.ReporterIDValid(dbus.Int64(rid)).items()}),
                outcome(lambda: [i - rid for i in r.GetAllReporters()]),
                outcome(lambda: r.StopReportingSession(dbus.Int64(rid))),
                outcome(lambda: r.DestroyReportingSession(dbus.Int64(rid))),
                outcome(lambda: client.notify.GetState("com.korvane.e2e.direct")),
            ]
            if rid == 100:
                over_bus = answers
            else:
                over_socket = answers
        self.assertEqual(over_socket, over_bus)
        self.assertEqual(over_bus[5][:2], ("error", LIMITS))
        self.assertEqual(over_bus[6][:2], ("error", LIMITS))
        self.assertIn("expecting 'qx'", over_bus[7][2])

        stats = self.direct_client().stats.GetStats()
        self.assertEqual((stats["bus_clients"], stats["direct_clients"]), (1, 1))
        self.assertEqual(stats["direct_connections"], 2)
        self.assertEqual(stats["limit_exceeded_payload_depth"], 2)
        self.assertEqual(stats["limit_exceeded_reporter_ids"], 2)

    def test_closing_the_connection_stops_its_sessions_as_leaving_the_bus_does(self):
        def run_and_leave(client, rid):
            client.create(rid, service_type=TEST_SERVICE,
                          config={"KXHostApplicationDisplayID": f"app{rid}"})
            client.start(rid)
            now = time.time()
            client.send({"qvreporting_timestamp": now - 30, "session_output_running": True,
                         "KXSessionVolume": 0.5}, PLAYBACK, START, [rid])
            client.send({"qvreporting_timestamp": now - 18, "session_output_running": False},
                        PLAYBACK, STOP, [rid])
            client.reporting.GetAllReporters()  # everything above has been taken in
            client.connection.close()  # without stopping the session

        def summaries():
            return [(e["event"], e["payload"].get("num_messages"), e["payload"].get("play_seconds"))
                    for e in self.daemon.events("com.korvane.qvsound.")
                    if e["event"].endswith(".Summary")]

        observer = self.client()
        run_and_leave(self.client(), 41)
        over_bus = wait_until(lambda: len(summaries()) == 2 and summaries(), timeout=30,
                              what="the summaries of the bus client's session")
        run_and_leave(self.direct_client(), 42)
        wait_until(lambda: len(summaries()) == 4, timeout=30,
                   what="the summaries of the direct client's session")
        self.assertEqual(summaries()[2:], over_bus)
        self.assertEqual([e[0].split(".")[3] for e in over_bus], ["Volume", "Session_Generic"])
        self.assertEqual(list(observer.reporting.GetAllReporters()), [])
        uptimes = wait_until(
            lambda: len(self.daemon.events("com.korvane.qvsound.qvreportingclientuptime")) == 2
            and self.daemon.events("com.korvane.qvsound.qvreportingclientuptime"),
            what="both clients' uptime")
        self.assertEqual({u["payload"]["processName"] for u in uptimes}, {"python3"})
        wait_until(lambda: self.direct_client().stats.GetStats()["direct_clients"] == 0,
                   what="the direct client to be dropped")

    def test_a_client_that_leaves_its_replies_unread_is_cut_off_and_counted(self):
        reader = self.direct_client()
        deaf = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
        self.addCleanup(deaf.close)
        deaf.settimeout(60)
        deaf.connect(self.direct_socket)
        deaf.sendall(b"\0AUTH EXTERNAL " + str(os.getuid()).encode().hex().encode() + b"\r\n")
        self.assertTrue(deaf.recv(128).startswith(b"OK "))
        deaf.sendall(b"BEGIN\r\n")
        calls = b"".join(method_call(serial, OBJECT_PATH, INTERFACE, "GetAllReporters")
                         for serial in range(1, 120001))
        try:
            deaf.sendall(calls)  # its replies are never read
        except OSError:
            pass  # cut off before all were sent
        wait_until(lambda: reader.stats.GetStats()["limit_exceeded_direct_replies_unread"] == 1,
                   timeout=30, what="the deaf client to be cut off")
        self.assertEqual(reader.stats.GetStats()["direct_connections"], 1)
        self.assertEqual(list(reader.reporting.GetAllReporters()), [])

    def test_only_root_may_kill_over_the_socket_and_the_socket_goes_with_a_clean_stop(self):
        os.chmod(self.workdir, 0o755)  # so that nobody reaches the socket
        script = f"""
import dbus
c = dbus.connection.Connection("unix:path={self.direct_socket}")
r = dbus.Interface(c.get_object(None, {OBJECT_PATH!r}, introspect=False), {INTERFACE!r})
try:
    r.KillService()
except dbus.exceptions.DBusException as e:
    print(e.get_dbus_name())
"""
        refused = subprocess.run(["setpriv", "--reuid=nobody", "--regid=nogroup", "--clear-groups",
                                  "/usr/bin/python3", "-c", script],
                                 capture_output=True, text=True, timeout=30)
        self.assertEqual(refused.stdout.strip(), "org.freedesktop.DBus.Error.AccessDenied",
                         refused.stderr)
        self.assertIsNone(self.daemon.process.poll())

        killer = self.direct_client()
        killer.reporting.KillService(ignore_reply=True)
        killer.connection.flush()
        self.assertEqual(self.daemon.process.wait(timeout=30), 2)
        # Killed, the daemon leaves its socket behind: the next one replaces it.
        self.assertTrue(os.path.exists(self.direct_socket))
        self.daemon.stop()
        self.daemon = Daemon(self.bus, self.daemon.state_dir, "--direct-socket",
                             self.direct_socket)
        self.assertEqual(list(self.direct_client().reporting.GetAllReporters()), [])
        self.assertEqual(self.daemon.stop(), 0)
        self.assertFalse(os.path.exists(self.direct_socket))


if __name__ == "__main__":
    unittest.main()

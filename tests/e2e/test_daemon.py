"""qvreportd driven over a private bus by an independent client (python3-dbus)."""

import json
import os
import signal
import subprocess
import sys
import time
import unittest

import dbus

sys.path.insert(0, os.path.dirname(__file__))
from harness import (BUS_NAME, Bus, Client, Daemon, DaemonTestCase, OBJECT_PATH, INTERFACE,
                     wait_until)  # noqa: E402

PLAYBACK, RECORD, INPUT, START, STOP, STATE = 4, 2, 3, 1, 2, 18
GENERIC_CATEGORY, GENERIC_TYPE = 1, 0


class SessionLife(DaemonTestCase):
    def test_messages_of_a_session_reach_the_analytics_sink_under_both_names(self):
        c = self.client()
        c.create(7, service_type=7, config={"KXHostApplicationDisplayID": "com.example.music"})
        c.start(7)
        now = time.time()
        c.send({"volume": 0.5, "qvreporting_timestamp": now, "key with blank": "x"}, PLAYBACK, START, [7])
        c.send({"volume": 0.5, "qvreporting_timestamp": now + 1, "key with blank": "x"}, PLAYBACK, START, [7])
        c.send({"volume": 0.7, "qvreporting_timestamp": now + 2, "key with blank": "x"}, PLAYBACK, START, [7])
        self.assertTrue(c.stop(7))
        self.assertTrue(c.destroy(7))

        generic = wait_until(lambda: len(self.daemon.events("com.korvane.qvsound.Playback.Start")) == 2
                             and self.daemon.events("com.korvane.qvsound.Playback.Start"),
                             what="two forwarded messages (the repeat is redundant)")
        named = self.daemon.events("com.korvane.longformaudio.Playback.Start")
        self.assertEqual(len(named), 2)
        first = generic[0]["payload"]
        self.assertEqual(first["volume"], 0.5)
        self.assertEqual(first["key_with_blank"], "x")
        self.assertEqual(first["audiotag"], "PlaybackStart")
        self.assertEqual(first["HostApplicationDisplayID"], "com.example.music")
        self.assertEqual(generic[1]["payload"]["volume"], 0.7)
        self.assertEqual(list(generic[0].keys())[0], "time")

    def test_unknown_ids_are_answered_with_success_and_change_nothing(self):
        c = self.client()
        r = c.reporting
        self.assertTrue(r.StartReportingSession(dbus.Int64(404)))
        self.assertTrue(r.StopReportingSession(dbus.Int64(404)))
        self.assertTrue(r.DestroyReportingSession(dbus.Int64(0)))
        self.assertTrue(r.SetServiceType(dbus.UInt16(3), dbus.Int64(404)))
        self.assertEqual(r.GetServiceNameForReporterID(dbus.Int64(404)), 65535)
        valid = r.ReporterIDValid(dbus.Int64(404))
        self.assertEqual(valid["reporterID"], 0)
        self.assertEqual(valid["serviceType"], 65535)
        self.assertIsInstance(valid["reporterID"], dbus.Int64)
        self.assertIsInstance(valid["serviceType"], dbus.UInt16)
        self.assertEqual(list(r.GetAllReporters()), [])


class TwoClients(DaemonTestCase):
    def test_a_message_without_ids_reaches_every_started_session_of_every_client(self):
        a, b = self.client(), self.client()
        a.create(1001, service_type=2)
        b.create(2002, service_type=3)
        a.start(1001)
        b.start(2002)
        self.assertEqual(sorted(a.reporting.GetAllReporters()), [1001, 2002])
        self.assertEqual(b.reporting.ReporterIDValid(dbus.Int64(1001))["serviceType"], 2)
        a.send({"broadcast": True}, GENERIC_CATEGORY, GENERIC_TYPE)
        wait_until(lambda: self.daemon.events("com.korvane.telephony.Generic.Generic")
                   and self.daemon.events("com.korvane.haptics.Generic.Generic"),
                   what="the broadcast in both sessions")
        # b cannot start a's session: the call is answered but nothing starts.
        b.create(3003)
        self.assertTrue(b.reporting.StartReportingSession(dbus.Int64(1001), timeout=5))

    def test_a_client_killed_mid_session_has_its_sessions_stopped_and_its_uptime_recorded(self):
        script = f"""
import dbus, sys, time
bus = dbus.bus.BusConnection({self.bus.address!r})
r = dbus.Interface(bus.get_object({BUS_NAME!r}, {OBJECT_PATH!r}, introspect=False), {INTERFACE!r})
r.CreateReportingSession(dbus.Int64(99))
r.StartReportingSession(dbus.Int64(99), ignore_reply=True)
r.GetAllReporters()
print("ready", flush=True)
time.sleep(60)
"""
        child = subprocess.Popen(["/usr/bin/python3", "-c", script], stdout=subprocess.PIPE, text=True)
        self.addCleanup(child.stdout.close)
        self.assertEqual(child.stdout.readline().strip(), "ready")
        observer = self.client()
        self.assertEqual(list(observer.reporting.GetAllReporters()), [99])
        child.kill()
        child.wait()
        wait_until(lambda: list(observer.reporting.GetAllReporters()) == [], what="session gone")
        uptime = wait_until(lambda: self.daemon.events("com.korvane.qvsound.qvreportingclientuptime"),
                            what="the uptime event")
        self.assertEqual(uptime[0]["payload"]["processName"], "python3")
        self.assertGreaterEqual(uptime[0]["payload"]["seconds"], 0)
        self.assertIn(f"removing {child.pid} from the server client list", self.daemon.log_text())


class SingleMessageSession(DaemonTestCase):
    def test_a_message_without_ids_while_nothing_runs_lives_in_the_shared_session_until_idle(self):
        c = self.client()
        c.send({"lonely": 1}, GENERIC_CATEGORY, GENERIC_TYPE)
        events = wait_until(lambda: self.daemon.events("com.korvane.standalone.Generic.Generic"),
                            what="the message in the standalone session")
        self.assertEqual(events[0]["payload"]["lonely"], 1)
        self.assertIn("Creating singleMessageSession", self.daemon.log_text())
        wait_until(lambda: "Stopping singleMessageSession after timeout=5.000000" in self.daemon.log_text(),
                   timeout=12, what="the idle session to be reaped")
        # Unknown IDs never make one.
        c.send({"nowhere": 1}, GENERIC_CATEGORY, GENERIC_TYPE, [123])
        self.assertEqual(self.daemon.log_text().count("Creating singleMessageSession"), 1)


class BadInput(DaemonTestCase):
    daemon_args = ("--max-payload-bytes", "65536")

    def assertRefused(self, call, error_name, text=None):
        with self.assertRaises(dbus.exceptions.DBusException) as caught:
            call()
        self.assertEqual(caught.exception.get_dbus_name(), error_name)
        if text:
            self.assertIn(text, caught.exception.get_dbus_message())

    def test_input_beyond_limits_or_of_foreign_types_is_refused_and_counted(self):
        c = self.client()
        c.create(5)
        deep = {"leaf": 1}
        for _ in range(20):
            deep = {"nested": dbus.Dictionary(deep, signature="sv")}
        with open(os.devnull) as f:
            fd_payload = {"descriptor": dbus.types.UnixFd(f)}
            self.assertRefused(lambda: c.send(fd_payload, 1, 0, [5]),
                               "org.freedesktop.DBus.Error.InvalidArgs", "descriptor")
        limits = "org.freedesktop.DBus.Error.LimitsExceeded"
        self.assertRefused(lambda: c.send(deep, 1, 0, [5]), limits)
        self.assertRefused(lambda: c.send({"big": "x" * 70000}, 1, 0, [5]), limits)
        self.assertRefused(lambda: c.send({"k": 1}, 1, 0, list(range(1, 2000))), limits)
        many = {f"k{i}": i for i in range(10001)}
        self.assertRefused(lambda: c.send(many, 1, 0, [5]), limits)
        stats = c.stats.GetStats()
        self.assertEqual(stats["limits_exceeded"], 4)
        self.assertEqual(stats["input_refused"], 1)
        # Everything else still works, also every kind of value the bus carries.
        c.start(5)
        c.send({"b": True, "y": dbus.Byte(7), "n": dbus.Int16(-3), "q": dbus.UInt16(3),
                "i": dbus.Int32(-70000), "u": dbus.UInt32(70000), "t": dbus.UInt64(2**64 - 1),
                "d": 0.1, "s": "ü", "o": dbus.ObjectPath("/a/b"), "g": dbus.Signature("a{sv}"),
                "ay": dbus.ByteArray(b"\x00\x01"), "st": dbus.Struct((1, "two"), signature="is"),
                "ax": dbus.Array([1, 2], signature="x"), "empty": dbus.Dictionary({}, signature="sv"),
                "": "empty key"}, 1, 0, [5])
        line = wait_until(lambda: self.daemon.events("com.korvane.qvsound.Generic.Generic"),
                          what="the message of every type")[0]["payload"]
        self.assertEqual(line["t"], 2**64 - 1)
        self.assertEqual(line["n"], -3)
        self.assertEqual(line["ay"], "AAE=")
        self.assertEqual(line["st"], [1, "two"])
        self.assertEqual(line["s"], "ü")
        self.assertEqual(line[""], "empty key")


class Notifications(DaemonTestCase):
    def test_a_ringer_change_posted_on_the_bus_reaches_running_sessions(self):
        c = self.client()
        c.create(8)
        c.start(8)
        c.notify.Post("com.korvane.deskhost.ringerstate", dbus.UInt64(1))
        self.assertEqual(c.notify.GetState("com.korvane.deskhost.ringerstate"), 1)
        setup = wait_until(lambda: [e for e in self.daemon.events("com.korvane.qvsound.Setup.Setup")
                                    if "ringerstate" in e["payload"]],
                           what="the ringer state in the session")
        self.assertIs(setup[0]["payload"]["ringerstate"], True)
        self.assertIn("last_updated", setup[0]["payload"])


class DerivedMessages(DaemonTestCase):
    def test_a_test_session_derives_volume_input_and_summary_and_writes_its_file(self):
        c = self.client()
        c.create(31, service_type=11, config={"KXHostApplicationDisplayID": "../e2e\napp"})
        c.start(31)
        now = time.time()
        playing = {"qvreporting_timestamp": now - 30, "session_output_running": True,
                   "KXSessionVolume": 0.5, "active_devices": "Speaker", "mFormatID": "lpcm",
                   "nested": dbus.Dictionary({"rate": 48000, "list": dbus.Array(
                       [dbus.Int64(1), "two", 3.5], signature="v")}, signature="sv")}
        c.send(playing, PLAYBACK, START, [31])
        c.send({"qvreporting_timestamp": now - 18, "session_output_running": False}, PLAYBACK,
               STOP, [31])
        c.send({"qvreporting_timestamp": now - 20, "session_input_running": True,
                "vp_config_primary_vocoder": "opus", "vp_config_primary_vocoderFs": "16000"},
               RECORD, START, [31])
        c.send({"qvreporting_timestamp": now - 17, "vp_config_primary_vocoder": "aac",
                "vp_config_primary_vocoderFs": "24000"}, INPUT, STATE, [31])
        c.send({"qvreporting_timestamp": now - 15, "session_input_running": False}, RECORD, STOP,
               [31])
        self.assertTrue(c.stop(31))

        summary = wait_until(lambda: self.daemon.events("com.korvane.test.Session_Generic.Summary"),
                             what="the summary in the analytics sink")
        volume = self.daemon.events("com.korvane.qvsound.Volume.Summary")
        self.assertEqual(len(volume), 1)
        self.assertAlmostEqual(volume[0]["payload"]["play_seconds"], 12.0, places=3)
        self.assertEqual(volume[0]["payload"]["play_secondsBucketed"], "10")
        self.assertEqual(volume[0]["payload"]["KXSessionVolumeBucketed"], "0.5")
        inputs = self.daemon.events("com.korvane.qvsound.Input.Summary")
        self.assertEqual(len(inputs), 1)
        self.assertEqual(inputs[0]["payload"]["inputrunning_secondsBucketed"], "5")
        self.assertEqual(inputs[0]["payload"]["vocoders"], "aac:24000,opus:16000")
        self.assertEqual(len(summary), 1)
        # The five sent, and the volume message, derived and received before the summary.
        self.assertEqual(summary[0]["payload"]["num_messages"], 6)
        self.assertEqual(summary[0]["payload"]["summaryServiceName"], "test")

        # One file, inside the directory whatever the application's name, that python reads back.
        directory = os.path.join(self.daemon.state_dir, "logs", "Audio", "Reporting")
        files = os.listdir(directory)
        self.assertEqual(len(files), 1)
        self.assertTrue(files[0].endswith("-31-%2E.%2Fe2e%0Aapp-test.json"), files[0])
        with open(os.path.join(directory, files[0])) as f:
            members = json.load(f)
        by_name = {name: payload for member in members for name, payload in member.items()}
        self.assertIn("Volume_Summary_1", by_name)
        self.assertIn("Input_Summary_1", by_name)
        self.assertIn("Session_Generic_Summary_1", by_name)
        start = by_name["Playback_Start_1"]
        for key, value in playing.items():
            self.assertEqual(start[key], value, key)
        self.assertEqual(start["isSessionStarted"], "YES")


class Shutdown(DaemonTestCase):
    def test_sigterm_stops_sessions_flushes_the_sinks_and_exits_zero(self):
        c = self.client()
        c.create(11)
        c.start(11)
        for i in range(200):
            c.send({"i": i}, PLAYBACK, START, [11])
        self.assertEqual(self.daemon.stop(signal.SIGTERM), 0)
        self.assertEqual(len(self.daemon.events("com.korvane.qvsound.Playback.Start")), 200)
        self.assertIn("stopping on", self.daemon.log_text())

    def test_losing_the_bus_stops_the_daemon_cleanly_even_amid_a_sigterm(self):
        # Alone, the bus vanishing stops the daemon; with a SIGTERM at the same moment, the stop
        # must not wait on a bus loop that already ended.
        for also_sigterm in (False, True):
            with self.subTest(also_sigterm=also_sigterm):
                if also_sigterm:
                    self.bus = Bus(self.workdir)
                    state = os.path.join(self.workdir, "state2")
                    os.makedirs(state)
                    self.daemon = Daemon(self.bus, state)
                c = Client(self.bus)
                c.create(12)
                c.start(12)
                for i in range(50):
                    c.send({"i": i}, PLAYBACK, START, [12])
                if also_sigterm:
                    self.daemon.process.send_signal(signal.SIGTERM)
                self.bus.process.kill()
                self.assertEqual(self.daemon.process.wait(timeout=10), 0)
                self.assertEqual(len(self.daemon.events("com.korvane.qvsound.Playback.Start")), 50)
                if not also_sigterm:
                    self.assertIn("lost the bus", self.daemon.log_text())
                self.bus.process.wait()
                self.bus.process.stdout.close()
                self.daemon.log.close()


if __name__ == "__main__":
    unittest.main(verbosity=2)

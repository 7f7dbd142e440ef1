"""qvreportd driven over a private bus by an independent client (python3-dbus)."""

import json
import os
import signal
import subprocess
import sys
import tempfile
import time
import unittest

import dbus

sys.path.insert(0, os.path.dirname(__file__))
from harness import (BUS_NAME, Bus, Client, Daemon, DaemonTestCase, OBJECT_PATH, INTERFACE,
                     wait_until)  # noqa: E402

PLAYBACK, RECORD, INPUT, START, STOP, STATE = 4, 2, 3, 1, 2, 18
GENERIC_CATEGORY, GENERIC_TYPE = 1, 0


class TwoClients(DaemonTestCase):
    def test_a_message_without_ids_reaches_every_started_session_of_every_client(self):
        a, b = self.client(), self.client()
        a.create(1001, service_type=2)
        b.create(2002, service_type=3)
        a.start(1001)
        b.start(2002)
        self.assertEqual(sorted(a.reporting.GetAllReporters()), [1001, 2002])
        a.send({"broadcast": True}, GENERIC_CATEGORY, GENERIC_TYPE)
        wait_until(lambda: self.daemon.events("com.korvane.telephony.Generic.Generic")
                   and self.daemon.events("com.korvane.haptics.Generic.Generic"),
                   what="the broadcast in both sessions")
        # Addressed, it reaches the named session alone (0 and unknown IDs are skipped); the
        # shared session is only for messages that nothing running takes.
        a.send({"addressed": True}, GENERIC_CATEGORY, GENERIC_TYPE, [0, 2002, 999])
        a.send({"last": True}, GENERIC_CATEGORY, GENERIC_TYPE)

        def sent(service):  # each session's messages reach the sink in order
            return [next(k for k in ("broadcast", "addressed", "last") if k in e["payload"])
                    for e in self.daemon.events(f"com.korvane.{service}.Generic.Generic")]
        wait_until(lambda: sent("telephony")[-1:] == sent("haptics")[-1:] == ["last"],
                   what="the last broadcast in both sessions")
        self.assertEqual(sent("telephony"), ["broadcast", "last"])
        self.assertEqual(sent("haptics"), ["broadcast", "addressed", "last"])
        self.assertNotIn("Creating singleMessageSession", self.daemon.log_text())

    def test_a_client_killed_mid_session_has_its_sessions_stopped_and_its_uptime_recorded(self):
        script = f"""
import dbus, time
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


class SingleMessageSession(DaemonTestCase):
    def test_a_message_without_ids_while_nothing_runs_lives_in_the_shared_session_until_idle(self):
        c = self.client()
        c.send({"lonely": 1}, GENERIC_CATEGORY, GENERIC_TYPE)
        events = wait_until(lambda: self.daemon.events("com.korvane.standalone.Generic.Generic"),
                            what="the message in the standalone session")
        self.assertEqual(events[0]["payload"]["lonely"], 1)
        wait_until(lambda: "Stopping singleMessageSession after timeout=5.000000" in self.daemon.log_text(),
                   timeout=30, what="the idle session to be reaped")
        c.send({"nowhere": 1}, GENERIC_CATEGORY, GENERIC_TYPE, [123])  # unknown IDs never make one
        self.assertEqual(self.daemon.log_text().count("Creating singleMessageSession"), 1)


class BadInput(DaemonTestCase):
    daemon_args = ("--max-payload-bytes", "65536")

    def assertRefused(self, call, error_name):
        with self.assertRaises(dbus.exceptions.DBusException) as caught:
            call()
        self.assertEqual(caught.exception.get_dbus_name(), error_name)
        return caught.exception.get_dbus_message()

    def test_input_beyond_limits_or_of_foreign_types_is_refused_and_counted(self):
        c = self.client()
        c.create(5)
        deep = {"leaf": 1}
        for _ in range(20):
            deep = {"nested": dbus.Dictionary(deep, signature="sv")}
        with open(os.devnull) as f:
            self.assertRefused(lambda: c.send({"fd": dbus.types.UnixFd(f)}, 1, 0, [5]),
                               "org.freedesktop.DBus.Error.InvalidArgs")
        limits = "org.freedesktop.DBus.Error.LimitsExceeded"
        self.assertRefused(lambda: c.send(deep, 1, 0, [5]), limits)
        # The refusal names the key that passed the limit.
        self.assertIn('"big"', self.assertRefused(
            lambda: c.send({"small": 1, "big": "x" * 70000}, 1, 0, [5]), limits))
        self.assertRefused(lambda: c.send({"k": 1}, 1, 0, list(range(1, 2000))), limits)
        self.assertRefused(lambda: c.send({f"k{i}": i for i in range(10001)}, 1, 0, [5]), limits)
        stats = c.stats.GetStats()
        self.assertEqual((stats["limits_exceeded"], stats["input_refused"]), (4, 1))
        c.start(5)
        c.send({"t": dbus.UInt64(2**64 - 1), "st": dbus.Struct((1, "two"), signature="is")}, 1, 0, [5])
        line = wait_until(lambda: self.daemon.events("com.korvane.qvsound.Generic.Generic"),
                          what="a good message after the bad ones")[0]["payload"]
        self.assertEqual((line["t"], line["st"]), (2**64 - 1, [1, "two"]))


class CallBudgets(DaemonTestCase):
    daemon_args = ("--max-held-calls-per-client", "2", "--max-call-bytes-per-client", "8192",
                   "--max-payload-bytes-per-second", "1")

    def test_held_starts_and_payload_bytes_are_bounded_per_client_and_unanswerable_calls_let_go(self):
        c, other = self.client(), self.client()
        for rid in (1, 2, 3):
            c.create(rid)
        c.start(1)
        for _ in range(50):  # starts of a started session: never answered, so nothing is kept
            c.start(1)
        wait_until(lambda: (lambda s: s["held_calls"] == 1 and s["calls_awaiting_reply"] == 1)(
            c.stats.GetStats()), what="the unanswerable starts to be let go")
        c.start(2)
        wait_until(lambda: c.stats.GetStats()["held_calls"] == 2, what="the second start held")
        refused = "org.freedesktop.DBus.Error.LimitsExceeded"
        with self.assertRaises(dbus.exceptions.DBusException) as caught:
            c.reporting.StartReportingSession(dbus.Int64(3))  # a third held call
        self.assertEqual(caught.exception.get_dbus_name(), refused)
        self.assertTrue(c.stop(1))  # answers its held start
        c.start(3)
        wait_until(lambda: c.stats.GetStats()["held_calls"] == 2,
                   what="the third start held")
        other.create(4)  # another client has budgets of its own
        other.start(4)

        # A burst up to the call budget passes; then the client waits for its allowance.
        c.send({"blob": "x" * 5000}, 1, 0, [3])
        c.send({"blob": "x" * 5000}, 1, 0, [3])
        with self.assertRaises(dbus.exceptions.DBusException) as caught:
            c.send({"blob": "x"}, 1, 0, [3])
        self.assertEqual(caught.exception.get_dbus_name(), refused)
        self.assertIn("a second", caught.exception.get_dbus_message())
        other.send({"blob": "x" * 5000}, 1, 0, [4])
        stats = c.stats.GetStats()
        self.assertEqual((stats["held_calls"], stats["held_calls_max"]), (3, 3))
        self.assertEqual(stats["limit_exceeded_payload_rate_per_client"], 1)
        self.assertGreaterEqual(stats["limit_exceeded_held_calls_per_client"], 1)


class Notifications(DaemonTestCase):
    def test_a_ringer_change_posted_on_the_bus_reaches_running_sessions(self):
        c = self.client()
        c.create(8)
        c.start(8)
        c.notify.Post("com.korvane.deskhost.ringerstate", dbus.UInt64(1))
        setup = wait_until(lambda: [e for e in self.daemon.events("com.korvane.qvsound.Setup.Setup")
                                    if "ringerstate" in e["payload"]],
                           what="the ringer state in the session")
        self.assertIs(setup[0]["payload"]["ringerstate"], True)


class DerivedMessages(DaemonTestCase):
    def test_a_test_session_derives_volume_input_and_summary_and_writes_its_file(self):
        c = self.client()
        c.create(31, service_type=11, config={"KXHostApplicationDisplayID": "../e2e\napp"})
        c.start(31)
        now = time.time()
        playing = {"qvreporting_timestamp": now - 30, "session_output_running": True,
                   "KXSessionVolume": 0.5, "nested": dbus.Dictionary({"list": dbus.Array(
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
        quoted = {"qvreporting_timestamp": now - 25, "text": 'a "quoted"\nline'}
        c.send(quoted, PLAYBACK, START, [31])
        c.send(quoted, PLAYBACK, START, [31])  # redundant: not written to the file
        directory = os.path.join(self.daemon.state_dir, "logs", "Audio", "Reporting")
        c.reporting.GetAllReporters()  # every message above has been taken in
        self.assertFalse(os.path.exists(directory), "nothing is written before the stop")
        self.assertTrue(c.stop(31))

        def summaries():
            return [e for e in self.daemon.events("com.korvane.qvsound.")
                    if e["event"].endswith(".Summary")]
        # The sink's thread writes them as they come: wait for the last one.
        wait_until(lambda: len(summaries()) == 3, what="the three summaries in the analytics sink")
        summaries = summaries()
        # Workers stop in their fixed order: volume before the summary, input after it.
        self.assertEqual([e["event"].split(".")[3] for e in summaries],
                         ["Volume", "Session_Generic", "Input"])
        volume, summary, inputs = (e["payload"] for e in summaries)
        self.assertAlmostEqual(volume["play_seconds"], 12.0, places=3)
        self.assertEqual(volume["KXSessionVolumeBucketed"], "0.5")
        self.assertEqual(inputs["inputrunning_secondsBucketed"], "5")
        self.assertEqual(inputs["vocoders"], "aac:24000,opus:16000")
        self.assertEqual(summary["num_messages"], 8)  # the seven sent and the volume message

        # One file, named by its local time and zone, inside the directory whatever the
        # application's name; a JSON array of one-member objects, each message under its kind
        # and count, in time order, that python reads back.
        files = os.listdir(directory)
        self.assertEqual(len(files), 1)
        self.assertRegex(files[0], r"^\d{8}-\d{6}[+-]\d{4}-31-%2E\.%2Fe2e%0Aapp-test\.json$")
        with open(os.path.join(directory, files[0])) as f:
            text = f.read()
        self.assertTrue(text.startswith("[\n{\n") and text.endswith("}\n]\n"), text)
        self.assertIn("}\n,\n{\n", text)
        members = json.loads(text)
        # (What the machine's own driver counters did meanwhile may follow, as ChannelStats.)
        self.assertEqual([name for member in members for name in member
                          if not name.startswith("ChannelStats_")],
                         ["Playback_Start_1", "Playback_Start_2", "Record_Start_1",
                          "Playback_Stop_1", "Input_State_1", "Record_Stop_1", "Setup_Start_1",
                          "Setup_Stop_1", "Volume_Summary_1", "Session_Generic_Summary_1",
                          "Input_Summary_1"])
        self.assertEqual({len(member) for member in members}, {1})
        by_name = {name: payload for member in members for name, payload in member.items()}
        for key, value in playing.items():
            self.assertEqual(by_name["Playback_Start_1"][key], value, key)
        self.assertEqual(by_name["Playback_Start_2"]["text"], quoted["text"])
        self.assertEqual(by_name["Volume_Summary_1"]["isSessionStarted"], "YES")


class Shutdown(DaemonTestCase):
    def test_sigterm_stops_sessions_flushes_the_sinks_and_exits_zero(self):
        c = self.client()
        c.create(11)
        c.start(11)
        for i in range(200):
            c.send({"i": i}, PLAYBACK, START, [11])
        self.assertEqual(self.daemon.stop(), 0)
        self.assertEqual(len(self.daemon.events("com.korvane.qvsound.Playback.Start")), 200)

    def test_losing_the_bus_amid_a_sigterm_still_stops_cleanly(self):
        # The stop must not wait on a bus loop that already ended.
        c = Client(self.bus)
        c.create(12)
        c.start(12)
        for i in range(50):
            c.send({"i": i}, PLAYBACK, START, [12])
        self.daemon.process.send_signal(signal.SIGTERM)
        self.bus.process.kill()
        self.assertEqual(self.daemon.process.wait(timeout=30), 0)
        self.assertEqual(len(self.daemon.events("com.korvane.qvsound.Playback.Start")), 50)


class KillService(DaemonTestCase):
    """KillService ends the process with status 2 once the sinks wrote what they accepted."""

    def test_writes_what_the_sinks_accepted_before_leaving(self):
        c = self.client()
        c.create(41)
        c.start(41)
        for i in range(300):  # each answered once its events are in the sink's buffer
            c.send({"i": i, "padding": "x" * 200}, PLAYBACK, START, [41])
        c.reporting.KillService(ignore_reply=True)
        self.assertEqual(self.daemon.process.wait(timeout=30), 2)
        lines = self.daemon.sink_lines("analytics")
        starts = [l for l in lines if l["event"] == "com.korvane.qvsound.Playback.Start"]
        self.assertEqual([l["payload"]["i"] for l in starts], list(range(300)))
        self.assertEqual([l["seq"] for l in lines], list(range(1, len(lines) + 1)))


if __name__ == "__main__":
    unittest.main(verbosity=2)

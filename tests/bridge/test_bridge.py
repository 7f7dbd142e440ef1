"""qvreport-pipewire against a real PipeWire with WirePlumber and the real qvreportd: real clients
play, record, change volume, move, crash and restart; the checks read what reached the daemon's
analytics sink."""

import json
import os
import shutil
import signal
import subprocess
import sys
import tempfile
import time
import unittest

from pwharness import (Bridge, Bus, Daemon, PipeWire, PipeWireUnavailable, make_tone, payloads,
                       wait_for, wait_until, with_app)

SLOW_CLIENT = os.environ.get("QV_BRIDGE_TEST_STREAMS", "qv_bridge_test_streams")

PLAYBACK_START = "com.korvane.qvsound.Playback.Start"
PLAYBACK_STOP = "com.korvane.qvsound.Playback.Stop"
VOLUME_STATE = "com.korvane.qvsound.Volume.State"
ROUTE_STATE = "com.korvane.qvsound.RouteChange.State"
VOLUME_SUMMARY = "com.korvane.qvsound.Volume.Summary"
SESSION_SUMMARY = "com.korvane.qvsound.Session_Generic.Summary"


class BridgeTestCase(unittest.TestCase):
    daemon_args = ()

    def setUp(self):
        self.workdir = tempfile.mkdtemp(prefix="qv-bridge-")
        if not os.environ.get("QV_KEEP_WORKDIR"):
            self.addCleanup(shutil.rmtree, self.workdir, ignore_errors=True)
        try:
            self.pw = PipeWire(self.workdir)
        except PipeWireUnavailable as e:
            self.skipTest(f"PipeWire cannot start here: {e}")
        self.addCleanup(self.pw.stop)
        self.bus = Bus(self.workdir)
        self.addCleanup(self.bus.stop)
        self.state = os.path.join(self.workdir, "state")
        os.makedirs(self.state)
        self.daemon = Daemon(self.bus, self.state, *self.daemon_args)
        self.addCleanup(self.daemon.stop)
        self.bridge = Bridge(self.pw, self.bus.address, self.workdir)
        self.addCleanup(self.bridge.stop)

    def tearDown(self):
        # Before the cleanups, which stop a daemon started after the bridge first: the bridge
        # would log that absence as if it had come during the test. The bridge stops first, so
        # the log ends with its counters.
        result = self._outcome.result
        if any(test is self for test, _ in result.failures + result.errors):
            try:
                self.bridge.stop()
            finally:
                lines = [l for l in self.bridge.text().splitlines() if "debug: event" not in l]
                print("--- bridge log (events left out):\n" + "\n".join(lines[-40:]),
                      file=sys.stderr)

    def tone(self, seconds, name=None, **kw):
        path = os.path.join(self.workdir, name or f"tone-{seconds}.wav")
        if not os.path.exists(path):
            make_tone(path, seconds, **kw)
        return path

    def wpctl(self, *args):
        self.pw.run("wpctl", *map(str, args))

    def bridge_events(self):
        """The operations the bridge queued for the daemon, as its debug log shows them."""
        # What follows the last newline is a line still being written.
        return [json.loads(line.split("debug: event ", 1)[1])
                for line in self.bridge.text().split("\n")[:-1] if "debug: event " in line]

    def change_volume_until_delivered(self, node, app_id, volumes):
        """Sets each volume in turn until one reaches the daemon: the queue is first in, first
        out, so by then the bridge has handed over all it held. A change that finds the queue
        still full is dropped; the next one tries again."""
        for volume in volumes:
            self.wpctl("set-volume", node, volume)
            try:
                wait_until(lambda v=volume: any(abs(p.get("KXSessionVolume", -1) - v) < 1e-4
                                                for p in with_app(self.daemon, VOLUME_STATE,
                                                                  app_id)),
                           timeout=15, what=f"the volume {volume} to reach the daemon")
                return
            except AssertionError:
                continue
        self.fail(f"none of the volumes {volumes} reached the daemon")

    def stop_all(self):
        """The bridge, then the daemon: every session stops and derives its messages."""
        self.assertEqual(self.bridge.stop(), 0, self.bridge.text()[-3000:])
        self.assertEqual(self.daemon.stop(), 0)


class Playback(BridgeTestCase):
    def test_a_song_gives_start_stop_and_derived_messages(self):
        player = self.pw.play(self.tone(3), "song", "Music")
        start = wait_for(self.daemon, PLAYBACK_START, "song")[0]
        self.assertIs(start["session_output_running"], True)
        self.assertEqual(start["KXSessionVolume"], 1.0)
        self.assertEqual(start["active_devices"], "Speaker")
        self.assertEqual(start["session_selected_format"].split(" ", 1)[1], "48000 Hz 2 ch")
        self.assertEqual(start["mChannelsPerFrame"], 2)
        self.assertEqual(player.wait(timeout=30), 0)
        # The node's going away stops the session: the daemon derives its messages at once.
        derived = wait_for(self.daemon, VOLUME_SUMMARY, "song")
        self.assertEqual(len(derived), 1)
        self.assertGreater(derived[0]["play_seconds"], 2.0)
        self.assertLess(derived[0]["play_seconds"], 6.0)
        self.assertEqual(derived[0]["KXSessionVolumeBucketed"], "1.0")
        summary = wait_for(self.daemon, SESSION_SUMMARY, "song")[0]
        self.assertEqual(summary["summaryServiceName"], "longformaudio")
        self.assertEqual(summary["clientProcessName"], "qvreport-pipewi")
        # Events named by service type too.
        self.assertTrue(with_app(self.daemon, "com.korvane.longformaudio.Playback.Stop", "song"))

    def test_volume_mute_and_moves_split_the_playback_into_stretches(self):
        player = self.pw.play(self.tone(12), "mover", "Movie")
        wait_for(self.daemon, PLAYBACK_START, "mover")
        node = self.pw.stream_of("mover")
        time.sleep(1.0)  # each stretch must outlast the daemon's 0.5 s minimum
        self.wpctl("set-volume", node, 0.5)
        self.assertEqual(wait_for(self.daemon, VOLUME_STATE, "mover")[-1]["KXSessionVolume"], 0.5)
        time.sleep(1.0)
        self.wpctl("set-mute", node, 1)
        self.assertEqual(wait_for(self.daemon, VOLUME_STATE, "mover", 2)[-1]["KXSessionVolume"],
                         0.0)
        time.sleep(1.0)
        self.wpctl("set-mute", node, 0)
        wait_for(self.daemon, VOLUME_STATE, "mover", 3)
        time.sleep(1.0)
        self.pw.run("pw-metadata", str(node), "target.object", "qvtest-headphones")
        route = wait_for(self.daemon, ROUTE_STATE, "mover")[-1]
        self.assertEqual(route["active_devices"], "Headphones")
        self.assertEqual(route["KXSessionVolume"], 0.5)
        time.sleep(1.0)
        player.send_signal(signal.SIGINT)
        player.wait(timeout=30)
        derived = wait_for(self.daemon, VOLUME_SUMMARY, "mover", 5)
        self.assertEqual([(d["KXSessionVolume"], d["active_devices"]) for d in derived],
                         [(1.0, "Speaker"), (0.5, "Speaker"), (0.0, "Speaker"), (0.5, "Speaker"),
                          (0.5, "Headphones")])
        self.assertEqual({d["msgcnt"] for d in derived}, {5})


class Roles(BridgeTestCase):
    def test_each_media_role_gives_its_service_type(self):
        table = {"Music": "longformaudio", "Movie": "longformaudio",
                 "Communication": "telephony", "Phone": "telephony",
                 "Notification": "systemsounds", "Event": "systemsounds", "Alarm": "alarms",
                 "Game": "nonlongformaudio", "Assistant": "vocalis", "Accessibility": "vocalis",
                 "Production": "generic"}
        path = self.tone(2)
        players = [self.pw.play(path, f"role-{role}", role) for role in table]
        for p in players:
            self.assertEqual(p.wait(timeout=60), 0)
        for role, service in table.items():
            wait_for(self.daemon, f"com.korvane.{service}.Playback.Stop", f"role-{role}",
                     what=f"the stop of the {role} stream under {service}")


class Recording(BridgeTestCase):
    def test_a_recording_gives_record_start_stop_and_an_input_message(self):
        out = os.path.join(self.workdir, "rec.wav")
        recorder = subprocess.Popen(["pw-record", "--media-role", "Communication", "-P",
                                     '{ application.id = "recorder" }', out], env=self.pw.env,
                                    stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
        start = wait_for(self.daemon, "com.korvane.qvsound.Record.Start", "recorder")[0]
        self.assertIs(start["session_input_running"], True)
        self.assertEqual(start["active_devices"], "Null Microphone")
        time.sleep(1.5)
        recorder.send_signal(signal.SIGINT)
        recorder.wait(timeout=30)
        stop = wait_for(self.daemon, "com.korvane.qvsound.Record.Stop", "recorder")[0]
        self.assertIs(stop["session_input_running"], False)
        derived = wait_for(self.daemon, "com.korvane.qvsound.Input.Summary", "recorder")[0]
        self.assertGreater(derived["inputrunning_seconds"], 1.0)
        self.assertTrue(with_app(self.daemon, "com.korvane.telephony.Record.Start", "recorder"))


class KilledClient(BridgeTestCase):
    def test_a_client_killed_mid_stream_still_ends_its_stretch(self):
        player = self.pw.play(self.tone(20), "victim")
        wait_for(self.daemon, PLAYBACK_START, "victim")
        time.sleep(1.5)
        player.kill()
        player.wait(timeout=10)
        stop = wait_for(self.daemon, PLAYBACK_STOP, "victim")[0]
        self.assertIs(stop["session_output_running"], False)
        derived = wait_for(self.daemon, VOLUME_SUMMARY, "victim")[0]
        self.assertGreater(derived["play_seconds"], 1.0)
        self.assertLess(derived["play_seconds"], 15.0)


class PipeWireRestart(BridgeTestCase):
    def test_pipewire_restarting_mid_stream_closes_and_reopens_sessions(self):
        player = self.pw.play(self.tone(30), "before")
        wait_for(self.daemon, PLAYBACK_START, "before")
        time.sleep(1.0)
        self.pw.stop_server()
        player.wait(timeout=30)
        # The stream's stretch ends when PipeWire goes: the bridge stops the session itself.
        wait_for(self.daemon, VOLUME_SUMMARY, "before")
        wait_until(lambda: "PipeWire went away" in self.bridge.text(), timeout=30,
                   what="the bridge to log PipeWire's going")
        self.pw.start()
        wait_until(lambda: "reconnected to PipeWire" in self.bridge.text(), timeout=30,
                   what="the bridge to reconnect")
        after = self.pw.play(self.tone(2), "after")
        self.assertEqual(after.wait(timeout=30), 0)
        wait_for(self.daemon, VOLUME_SUMMARY, "after")
        self.stop_all()
        self.assertIn("pipewire_reconnects=1", self.bridge.text())


class DaemonRestart(BridgeTestCase):
    def test_a_restarted_daemon_gets_the_live_sessions_again(self):
        player = self.pw.play(self.tone(8), "survivor", "Game")
        wait_for(self.daemon, PLAYBACK_START, "survivor")
        time.sleep(1.0)
        self.assertEqual(self.daemon.stop(), 0)
        self.daemon = Daemon(self.bus, self.state)
        self.addCleanup(self.daemon.stop)
        wait_until(lambda: "re-created 1 sessions" in self.bridge.text(), timeout=30,
                   what="the bridge to make the session again")
        starts = wait_for(self.daemon, PLAYBACK_START, "survivor", 2)
        self.assertIs(starts[1]["session_output_running"], True)
        self.assertEqual(player.wait(timeout=30), 0)
        # The first daemon stopped while the stream played: a stretch still open at a stop is not
        # reported. The second daemon's stretch runs from the re-made session to the song's end.
        derived = wait_for(self.daemon, "com.korvane.nonlongformaudio.Volume.Summary", "survivor")
        self.assertEqual(len(derived), 1)
        self.assertGreater(derived[0]["play_seconds"], 2.0)
        self.stop_all()
        self.assertIn("daemon_reconnects=1", self.bridge.text())


class DaemonAwayOrStalled(BridgeTestCase):
    def test_an_absent_daemon_costs_undelivered_messages_and_a_stalled_one_a_bounded_queue(self):
        self.bridge.stop()
        self.daemon.stop()
        # Absent: the bridge keeps the stream's state and makes the session once it comes.
        self.bridge = Bridge(self.pw, self.bus.address, self.workdir, "--queue-size", "4")
        self.addCleanup(self.bridge.stop)
        player = self.pw.play(self.tone(30), "patient")
        node = self.pw.stream_of("patient")
        wait_until(lambda: "wait for it" in self.bridge.text(), timeout=30,
                   what="the bridge to notice the daemon's absence")
        # A volume set while the stream is still being set up can be lost: it is set once the
        # bridge has seen the stream run, and the daemon comes once the bridge has seen it.
        wait_until(lambda: any(e.get("category") == 4 and e.get("type") == 1
                               for e in self.bridge_events()),
                   timeout=30, what="the bridge to see the stream run")
        self.wpctl("set-volume", node, 0.25)
        wait_until(lambda: any(abs(e.get("payload", {}).get("KXSessionVolume", -1) - 0.25) < 1e-4
                               for e in self.bridge_events()),
                   timeout=30, what="the bridge to see the volume 0.25")
        self.daemon = Daemon(self.bus, self.state)
        self.addCleanup(self.daemon.stop)
        start = wait_for(self.daemon, PLAYBACK_START, "patient")[0]
        self.assertAlmostEqual(start["KXSessionVolume"], 0.25, places=5)
        # Stalled: the daemon stops answering; the bridge's queue holds 4 messages, then drops.
        os.kill(self.daemon.process.pid, signal.SIGSTOP)
        try:
            for i in range(12):
                self.wpctl("set-volume", node, 0.3 + i * 0.05)
                time.sleep(0.05)
            wait_until(lambda: "events dropped" in self.bridge.text(), timeout=30,
                       what="the bridge to drop events")
        finally:
            os.kill(self.daemon.process.pid, signal.SIGCONT)
        # Until the bridge catches up with the continued daemon its queue stays full, and the
        # stream's Stop would be dropped like any message that finds it so.
        self.change_volume_until_delivered(node, "patient", [0.9 + i * 0.01 for i in range(6)])
        player.kill()
        player.wait(timeout=10)
        wait_for(self.daemon, PLAYBACK_STOP, "patient")
        self.stop_all()
        log = self.bridge.text()
        self.assertRegex(log, r"messages_undelivered=[1-9]")
        self.assertRegex(log, r"events_dropped=[1-9]")


class Xruns(BridgeTestCase):
    daemon_args = ("--internal-build",)

    def test_a_slow_client_reports_overloads_that_ask_for_a_stack_sample(self):
        ctl = [os.environ.get("QVREPORTCTL", "qvreportctl"), "--state-dir", self.state]
        subprocess.run(ctl + ["defaults", "write", "com.korvane.qvsound.qvreporting",
                              "enable_spinlog", "true"], check=True, capture_output=True)
        slow = subprocess.Popen([SLOW_CLIENT, "--streams", "1", "--seconds", "4", "--overrun",
                                 "--app-id", "sluggish"], env=self.pw.env,
                                stdout=subprocess.DEVNULL, stderr=subprocess.PIPE, text=True)
        errors = wait_for(self.daemon, "com.korvane.qvsound.IO.Error", "sluggish")
        first = errors[0]
        self.assertEqual(first["issue_type"], "overload")
        self.assertGreaterEqual(first["smallest_buffer_frame_size"], 512)
        self.assertGreaterEqual(first["xrun_count"], 1)
        self.assertEqual(slow.wait(timeout=60), 0, slow.stderr.read())
        summary = wait_for(self.daemon, SESSION_SUMMARY, "sluggish")[0]
        self.assertGreaterEqual(summary["overload_count"], 1)
        wait_until(lambda: os.path.exists(os.path.join(self.state, "sinks", "diagnostics.jsonl")),
                   timeout=30, what="the overload's stack-sample request")
        with open(os.path.join(self.state, "sinks", "diagnostics.jsonl")) as f:
            self.assertIn("AudioOverloads", f.read())


if __name__ == "__main__":
    unittest.main()

"""The diagnostics workers end to end: an internal-build qvreportd whose settings were written
with qvreportctl before it started, driven over a private bus by an independent client."""

import json
import os
import shutil
import subprocess
import sys
import tempfile
import time
import unittest

import dbus
from dbus.mainloop.glib import DBusGMainLoop
from gi.repository import GLib

sys.path.insert(0, os.path.dirname(__file__))
from harness import (DAEMON, NOTIFY_INTERFACE, Bus, Client, Daemon, jsonl_lines, wait_until)  # noqa: E402

CTL = os.path.join(os.path.dirname(os.path.abspath(DAEMON)), "qvreportctl")
SUITE = "com.korvane.qvsound.qvreporting"
IO, ERROR_TYPE, SETUP, GENERIC_TYPE = 7, 6, 8, 0
DROPPED_SPINLOG = "com.korvane.qvsound.dropped-spinlog"


class DiagnosticsTestCase(unittest.TestCase):
    settings = {}
    with_session_bus = False

    def setUp(self):
        self.workdir = tempfile.mkdtemp(prefix="qv-e2e-")
        self.bus = Bus(self.workdir)
        self.state = os.path.join(self.workdir, "state")
        os.makedirs(self.state)
        for key, value in self.settings.items():
            subprocess.run([CTL, "--state-dir", self.state, "defaults", "write", SUITE, key,
                            json.dumps(value)], check=True)
        saved = os.environ.get("DBUS_SESSION_BUS_ADDRESS")
        # The private bus stands for the desktop's session bus where the test asks for one.
        os.environ["DBUS_SESSION_BUS_ADDRESS"] = self.bus.address if self.with_session_bus else ""
        try:
            self.daemon = Daemon(self.bus, self.state, "--internal-build")
        finally:
            if saved is None:
                del os.environ["DBUS_SESSION_BUS_ADDRESS"]
            else:
                os.environ["DBUS_SESSION_BUS_ADDRESS"] = saved
        self.children = []

    def tearDown(self):
        # A sample still running is stopped with the daemon, which still exits cleanly.
        status = self.daemon.stop()
        for child in self.children:
            child.kill()
            child.wait()
            if child.stdout:
                child.stdout.close()
        self.bus.stop()
        shutil.rmtree(self.workdir, ignore_errors=True)
        self.assertEqual(status, 0)

    def sink(self, name, op=None):
        lines = jsonl_lines(os.path.join(self.state, "sinks", name + ".jsonl"))
        return [l for l in lines if op is None or l["op"] == op]

    def logged(self, text):
        return self.daemon.log_text().count(text)


class PulsarOverloads(DiagnosticsTestCase):
    settings = {"enable_spinlog": True, "wait_time": 1000}

    def listen_for_posts(self):
        posted = []
        loop = DBusGMainLoop()
        listener = dbus.bus.BusConnection(self.bus.address, mainloop=loop)
        listener.add_signal_receiver(lambda name, state: posted.append(str(name)),
                                     signal_name="Posted", dbus_interface=NOTIFY_INTERFACE)
        self.addCleanup(listener.close)
        context = GLib.MainContext.default()

        def seen():
            while context.iteration(False):
                pass
            return posted
        return seen

    def test_a_qualifying_overload_is_requested_then_announced_and_sampled_where_perf_can(self):
        posts = self.listen_for_posts()
        c = self.client = Client(self.bus)
        c.create(41, config={"KXHostApplicationDisplayID": "com.example.daw"})
        c.start(41)
        c.send({"smallest_buffer_frame_size": 256}, IO, ERROR_TYPE, [41])
        c.send({"smallest_buffer_frame_size": 1024, "io_cycle": 2,
                "nested": dbus.Dictionary({"thread": "io"}, signature="sv")}, IO, ERROR_TYPE, [41])
        requests = wait_until(lambda: self.sink("diagnostics", "request"), what="the request")
        wait_until(lambda: DROPPED_SPINLOG in posts(), what="the dropped-spinlog notification")
        # Too soon for a second one (10 s apart at least), whatever its size.
        c.send({"smallest_buffer_frame_size": 4096}, IO, ERROR_TYPE, [41])
        wait_until(lambda: self.logged("Interested in overload") >= 3, what="the third overload")
        self.assertEqual(len(self.sink("diagnostics", "request")), 1)

        request = requests[0]
        self.assertEqual((request["domain"], request["kind"], request["description"]),
                         ("com.korvane.qvsound", "AudioOverloads", "com.example.daw"))
        self.assertEqual(request["payload"]["smallest_buffer_frame_size"], 1024)
        self.assertEqual(request["payload"]["nested"], {"thread": "io"})
        self.assertEqual(request["options"], {"sampleStacks": True, "callGraphs": True,
                                              "extendedWindow": False, "userSpaceOnly": False,
                                              "skipReport": False})
        self.assertIn("Dropped spinlog", self.daemon.log_text())

        # The sample: taken where perf is installed and permitted, else the reason is logged.
        sample = wait_until(lambda: self.sink("diagnostics", "sample"), timeout=90,
                            what="the sample's outcome")[0]
        spinlogs = os.path.join(self.state, "logs", "Audio", "Spinlogs")
        if sample["ok"]:
            self.assertTrue(sample["data"].startswith(spinlogs + os.sep))
            self.assertGreater(os.path.getsize(sample["data"]), 0)
            with open(sample["report"], errors="replace") as f:
                self.assertIn("# Samples", f.read(4096))
        else:
            self.assertIn("stack samples", self.daemon.log_text())
        self.assertEqual(list(c.reporting.GetAllReporters()), [41])

    def test_a_flood_from_many_sessions_asks_once_per_session_and_samples_one_at_a_time(self):
        c = Client(self.bus)
        ids = list(range(100, 120))
        for rid in ids:
            c.create(rid)
            c.start(rid)
        for round_ in range(5):
            for rid in ids:
                c.send({"smallest_buffer_frame_size": "2048 frames", "round": round_}, IO,
                       ERROR_TYPE, [rid])
        # Values of the wrong kind are read as 0 and ignored; the daemon keeps serving.
        for bad in ("abc", float("nan"), dbus.Array([1024], signature="v"), True):
            c.send({"smallest_buffer_frame_size": bad, "HostApplicationDisplayID": 42}, IO,
                   ERROR_TYPE, [ids[0]])
        wait_until(lambda: self.logged("Interested in overload") >= 104, what="every overload")
        requests = self.sink("diagnostics", "request")
        self.assertEqual(len(requests), len(ids))
        self.assertEqual({r["description"] for r in requests}, {"Unknown"})
        self.assertLessEqual(sum(1 for r in requests if r["sampled"]), 1)
        for r in requests:
            if not r["sampled"]:
                self.assertTrue(r["reason"] == "a sample is already being taken"
                                or "perf" in r["reason"], r["reason"])
        self.assertEqual(len(list(c.reporting.GetAllReporters())), len(ids))


# The draft line of the Vidcall x/y error of a python3 client.
DRAFT = {
    "op": "draft", "draft": 1, "processName": "python3",
    "displayReason": "a Vidcall spatial positioning error occurred",
    "title": "Invalid x/y coordinates during a Vidcall call (ITF)",
    "problemDescription": "Invalid coordinates were provided to the audio layer during a Vidcall "
                          "call, making it impossible to render spatial audio correctly. Filing "
                          "this tracker will help determine what went wrong.",
    "component": {"name": "Vidcall Core - Callwire", "version": "All", "identifier": 1174093},
    "reproducibility": 6, "classification": 7,
    "diagnosticExtensionIdentifiers": ["com.korvane.DiagnosticExtensions.audio"]}


class IssueFilerPrompt(DiagnosticsTestCase):
    settings = {"VidcallInvalidXyBackOffSeconds": 3600}
    with_session_bus = True

    def test_an_xy_error_after_the_grace_period_files_one_draft_and_notifies_the_desktop(self):
        notified = os.path.join(self.workdir, "notified.jsonl")
        server = subprocess.Popen(
            ["/usr/bin/python3", os.path.join(os.path.dirname(__file__), "notification_server.py"),
             self.bus.address, notified], stdout=subprocess.PIPE, text=True)
        self.children.append(server)
        self.assertEqual(server.stdout.readline().strip(), "ready")

        c = Client(self.bus)
        now = time.time()
        c.create(51, config={"KXHostApplicationDisplayID": "com.example.vidcall"})
        c.start(51)
        # Client time stamps: the first message opens the 5-second grace period in the past.
        c.send({"qvreporting_timestamp": now - 10, "vcac_position": 1}, SETUP, GENERIC_TYPE, [51])
        c.send({"qvreporting_timestamp": now - 6, "vcac_invalid_x": 2.5}, IO, ERROR_TYPE, [51])
        c.send({"qvreporting_timestamp": now, "vcac_invalid_y": 1.5}, IO, ERROR_TYPE, [51])
        c.send({"qvreporting_timestamp": now + 1, "vcac_invalid_y": 9.5}, IO, ERROR_TYPE, [51])
        prompts = wait_until(lambda: self.sink("issuefiler", "prompt"), what="the prompt")
        drafts = self.sink("issuefiler", "draft")
        self.assertEqual(len(drafts), 1)
        self.assertEqual({k: v for k, v in drafts[0].items() if k not in ("time", "seq")}, DRAFT)
        self.assertEqual(prompts[0]["shown"], True)
        # The server may answer before it writes down what it showed.
        notes = wait_until(lambda: jsonl_lines(notified), what="the notification server's record")
        self.assertEqual(len(notes), 1)
        self.assertEqual(notes[0]["summary"], drafts[0]["title"])
        self.assertIn("python3: a Vidcall spatial positioning error occurred", notes[0]["body"])
        wait_until(lambda: "Successfully created draft" in self.daemon.log_text(),
                   what="the completion")

        # Another session within the back-off asks nothing; the last run is in the suite's file.
        c.create(52)
        c.start(52)
        c.send({"qvreporting_timestamp": now - 10, "a": 1}, SETUP, GENERIC_TYPE, [52])
        c.send({"qvreporting_timestamp": now, "vcac_invalid_x": 3}, IO, ERROR_TYPE, [52])
        wait_until(lambda: self.logged("Issue filer has run. key=VidcallInvalidXyITFlastRun") >= 2,
                   what="the back-off to refuse")
        self.assertEqual(len(self.sink("issuefiler", "draft")), 1)
        with open(os.path.join(self.state, "defaults", SUITE + ".json")) as f:
            self.assertIn("VidcallInvalidXyITFlastRun", json.load(f))



class IssueFilerWithoutDesktop(DiagnosticsTestCase):
    settings = {"VidcallInvalidXyBackOffSeconds": 0}  # hasRun alone: one draft a session

    def test_without_a_session_bus_each_draft_is_recorded_and_the_cause_said_once(self):
        c = Client(self.bus)
        now = time.time()
        for rid in (61, 62):
            c.create(rid)
            c.start(rid)
            c.send({"qvreporting_timestamp": now - 10, "vcac_position": 1}, SETUP, GENERIC_TYPE,
                   [rid])
            c.send({"qvreporting_timestamp": now, "vcac_invalid_x": 2}, IO, ERROR_TYPE, [rid])
        prompts = wait_until(lambda: len(self.sink("issuefiler", "prompt")) == 2
                             and self.sink("issuefiler", "prompt"), what="both prompts")
        self.assertEqual([(p["draft"], p["shown"], p["reason"]) for p in prompts],
                         [(1, False, "no session bus"), (2, False, "no session bus")])
        self.assertEqual([d["draft"] for d in self.sink("issuefiler", "draft")], [1, 2])
        # A draft recorded is a draft created.
        wait_until(lambda: self.logged("Successfully created draft") == 2, what="both completions")
        self.assertEqual(self.logged("issue filer: no session bus"), 1)


if __name__ == "__main__":
    unittest.main(verbosity=2)

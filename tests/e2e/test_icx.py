"""Issue capture end to end: an internal build whose device has haptic hardware, a python client
sending a haptic leak sequence, and the capture the daemon takes of that client."""

import json
import os
import shutil
import subprocess
import sys
import tempfile
import time
import unittest
import uuid

sys.path.insert(0, os.path.dirname(__file__))
from harness import DAEMON, DaemonTestCase, jsonl_lines, wait_until  # noqa: E402

PLAYBACK, ERROR, ISSUE_DETECTOR, ENERGY_LOG, HAPTICS, ALARMS = 4, 11, 7, 8, 3, 4
JOURNAL_REMOTE = "/lib/systemd/systemd-journal-remote"


def write_journal(directory, pid, message):
    """A real journal file holding one entry of process pid, written by systemd-journal-remote
    from an export-format stream. False when the writer is not installed."""
    if not os.path.exists(JOURNAL_REMOTE):
        return False
    now_us = int(time.time() * 1e6)
    entry = (f"__REALTIME_TIMESTAMP={now_us}\n__MONOTONIC_TIMESTAMP=1\n"
             f"_BOOT_ID={uuid.uuid4().hex}\n_PID={pid}\n_COMM=python3\n"
             f"SYSLOG_IDENTIFIER=icx-e2e\nMESSAGE={message}\n\n")
    subprocess.run([JOURNAL_REMOTE, f"--output={directory}/client.journal", "-"],
                   input=entry.encode(), check=True, capture_output=True)
    return True


class CaptureTestCase(DaemonTestCase):
    """An internal build whose device has haptic hardware, its journal in a directory of its own."""

    def setUp(self):
        self.extra = tempfile.mkdtemp(prefix="qv-icx-")
        self.addCleanup(shutil.rmtree, self.extra, True)
        self.journal = os.path.join(self.extra, "journal")
        os.makedirs(self.journal)
        device = os.path.join(self.extra, "device.json")
        with open(device, "w") as f:
            json.dump({"InternalBuild": True, "capabilities": {"haptics": True}}, f)
        self.daemon_args = ("--device-file", device, "--journal-dir", self.journal)
        super().setUp()

    def captures(self):
        root = os.path.join(self.daemon.state_dir, "logs", "Audio", "Captures")
        if not os.path.isdir(root):
            return []
        return [os.path.join(root, d) for d in sorted(os.listdir(root))
                if os.path.exists(os.path.join(root, d, "manifest.json"))]

    def sink_lines(self):
        return jsonl_lines(os.path.join(self.daemon.state_dir, "sinks", "issuecapture.jsonl"))


class HapticLeakCapture(CaptureTestCase):
    def test_a_haptic_leak_sequence_captures_the_clients_journal_lines_and_status(self):
        marker = f"icx e2e marker {uuid.uuid4().hex}"
        journal_written = write_journal(self.journal, os.getpid(), marker)

        c = self.client()
        c.create(501, service_type=HAPTICS)
        c.start(501)
        c.send({"Haptic_Active_Hardware_Time_Seconds": 1.5}, PLAYBACK, ENERGY_LOG, [501])
        self.assertEqual(self.captures(), [])
        c.send({"Haptic_Active_Hardware_Time_Seconds": 2.5}, PLAYBACK, ENERGY_LOG, [501])
        captures = wait_until(self.captures, what="the capture's manifest")
        self.assertEqual(len(captures), 1)
        capture = captures[0]
        with open(os.path.join(capture, "manifest.json")) as f:
            manifest = json.load(f)
        self.assertEqual(manifest["kind"], "snapshot")
        self.assertEqual(manifest["signature"], {
            "domain": "AudioAnalytics", "type": "haptics", "subtype": "Playback",
            "subtypeContext": "EnergyLog", "detectedProcess": "Unknown"})
        self.assertEqual(manifest["processIDs"], [os.getpid()])

        with open(os.path.join(capture, f"status-{os.getpid()}.txt")) as f:
            status = f.read()
        self.assertIn("Name:\tpython3", status)
        self.assertIn(f"Pid:\t{os.getpid()}", status)

        wait_until(lambda: "Started ICX session for haptics leaks. sessionId="
                   + os.path.basename(capture) in self.daemon.log_text(), what="the reply's log line")
        lines = wait_until(lambda: len(self.sink_lines()) >= 2 and self.sink_lines(),
                           what="the sink lines")
        self.assertEqual([l["op"] for l in lines], ["snapshot", "reply"])
        self.assertEqual(lines[0]["duration"], 0)
        self.assertEqual(lines[0]["payload"]["DEParameters"][
            "com.korvane.EnergylogCore.DESysLogFilterProcess"]["processIDs"], [os.getpid()])
        self.assertEqual(lines[1]["reply"], {"success": True, "sessionID": os.path.basename(capture)})

        ctl = os.path.join(os.path.dirname(DAEMON), "qvreportctl")
        listed = subprocess.run([ctl, "--state-dir", self.daemon.state_dir, "--json", "captures"],
                                check=True, capture_output=True, text=True).stdout.splitlines()
        self.assertEqual([json.loads(l)["id"] for l in listed], [os.path.basename(capture)])

        if not journal_written:
            self.skipTest(f"{JOURNAL_REMOTE} is not installed (Debian package "
                          "systemd-journal-remote): no journal to read; the /proc part passed")
        with open(os.path.join(capture, "journal.txt")) as f:
            journal = f.read()
        self.assertIn(f"icx-e2e[{os.getpid()}]: {marker}", journal)
        self.assertEqual(manifest["journal"]["lines"], 1)



class AlarmLowLevel(CaptureTestCase):
    def test_a_low_level_alarm_asks_for_one_timed_capture_and_cancels_it_at_stop(self):
        c = self.client()
        c.create(601, service_type=ALARMS)
        c.start(601)
        for n in range(6):  # the third fires, once in the session
            c.send({"issue_type": "LowRMS", "n": n}, ERROR, ISSUE_DETECTOR, [601])
        reply = wait_until(lambda: [l for l in self.sink_lines() if l["op"] == "reply"],
                           what="the reply")[0]
        capture = reply["sessionID"]
        requests = [l for l in self.sink_lines() if l["op"] == "session"]
        self.assertEqual([(r["duration"], r["sessionID"]) for r in requests], [(60, capture)])
        self.assertNotIn("payload", requests[0])
        self.assertEqual(requests[0]["signature"], {
            "domain": "AudioAnalytics", "type": "alarms", "subtype": "Error",
            "subtypeContext": "IssueDetector", "detectedProcess": "python3"})
        wait_until(lambda: f"Started ICX session for alarm Low RMS. sessionId={capture} "
                   "timeout=60.000000" in self.daemon.log_text(), what="the reply's log line")

        self.assertTrue(c.stop(601))
        cancels = wait_until(lambda: [l for l in self.sink_lines() if l["op"] == "cancel"],
                             what="the cancel")
        self.assertEqual([l["sessionID"] for l in cancels], [capture])


if __name__ == "__main__":
    unittest.main()

"""Performance traces of "test" sessions on an internal build, recorded by the real daemon.

Trace records through the kernel's tracefs: it needs root, and mounts tracefs on
/sys/kernel/tracing when nothing is mounted there (unmounting it again at the end); elsewhere it is
skipped with the reason. TraceWithoutTracefs points the daemon at a directory that is no tracefs
and runs anywhere.
"""

import glob
import json
import os
import subprocess
import sys
import time
import unittest

sys.path.insert(0, os.path.dirname(__file__))
from harness import DaemonTestCase  # noqa: E402

TRACEFS = "/sys/kernel/tracing"
TEST_SERVICE = 11

PROBES = """<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0">
<array>
  <dict>
    <key>Name</key><string>pipeline</string>
    <key>Children</key>
    <array>
      <dict>
        <key>Name</key><string>decode</string>
        <key>BeginMarker</key><string>qv:e2e:decode:begin</string>
        <key>EndMarker</key><string>qv:e2e:decode:end</string>
      </dict>
      <dict>
        <key>Name</key><string>render</string>
        <key>BeginMarker</key><string>qv:e2e:render:begin</string>
        <key>EndMarker</key><string>qv:e2e:render:end</string>
      </dict>
    </array>
  </dict>
  <dict>
    <key>Name</key><string>never</string>
    <key>BeginMarker</key><string>qv:e2e:never:begin</string>
    <key>EndMarker</key><string>qv:e2e:never:end</string>
  </dict>
</array>
</plist>
"""


def tracefs_mounted():
    with open("/proc/mounts") as f:
        return any(line.split()[1:3] == [TRACEFS, "tracefs"] for line in f)


def write_marker(path, text):
    with open(path, "w") as f:
        f.write(text + "\n")


class TraceSessionCase(DaemonTestCase):
    def start_test_session(self, rid, extra=None):
        probes = os.path.join(self.workdir, "probes.plist")
        with open(probes, "w") as f:
            f.write(PROBES)
        config = {"QVReportingThreadlinePlistFilePath": probes,
                  "QVReportingThreadlineOutputFileName": "e2e-results.gdj",
                  "KXHostApplicationDisplayID": "com.example.e2e"}
        config.update(extra or {})
        c = self.client()
        c.create(rid, service_type=TEST_SERVICE, config=config)
        c.start(rid)
        # The worker's start runs on the daemon's queue: a later call returns after it.
        c.reporting.GetAllReporters()
        return c

    def results_path(self):
        return os.path.join(self.daemon.state_dir, "logs", "Audio", "Traces", "e2e-results.gdj")


class Trace(TraceSessionCase):
    daemon_args = ("--internal-build",)
    mounted_here = False

    @classmethod
    def setUpClass(cls):
        if os.geteuid() != 0:
            raise unittest.SkipTest("recording a trace needs root (tracefs)")
        if not tracefs_mounted():
            done = subprocess.run(["mount", "-t", "tracefs", "nodev", TRACEFS],
                                  capture_output=True, text=True)
            if done.returncode != 0:
                raise unittest.SkipTest("tracefs cannot be mounted here: " + done.stderr.strip())
            cls.mounted_here = True
        if not os.path.isdir(os.path.join(TRACEFS, "instances")):
            cls.tearDownClass()
            raise unittest.SkipTest("this kernel's tracefs offers no trace instances")

    @classmethod
    def tearDownClass(cls):
        if cls.mounted_here:
            # A program that still holds a tracefs file keeps it busy: detach it then.
            if subprocess.run(["umount", TRACEFS], capture_output=True).returncode != 0:
                subprocess.run(["umount", "-l", TRACEFS], capture_output=True)
            cls.mounted_here = False

    def test_markers_written_during_a_test_session_come_back_as_durations(self):
        c = self.start_test_session(601)
        self.assertIn("Performance Trace Started", self.daemon.log_text())
        ours = os.path.join(TRACEFS, "instances", f"qvreportd-{self.daemon.process.pid}-*")
        instances = glob.glob(ours)
        self.assertEqual(len(instances), 1, instances)
        # The instance's clock is the monotonic one, and the template's events are on.
        with open(os.path.join(instances[0], "trace_clock")) as f:
            self.assertIn("[mono]", f.read())
        with open(os.path.join(instances[0], "events", "sched", "sched_switch", "enable")) as f:
            self.assertEqual(f.read(), "1\n")
        marker = os.path.join(instances[0], "trace_marker")
        for _ in range(3):
            write_marker(marker, "qv:e2e:decode:begin")
            time.sleep(0.03)
            write_marker(marker, "qv:e2e:decode:end")
        write_marker(marker, "qv:e2e:decode:end")  # unpaired: dropped
        copies_top_level = os.path.exists(os.path.join(instances[0], "options", "copy_trace_marker"))
        if copies_top_level:  # the documented way: the top-level trace_marker
            write_marker(os.path.join(TRACEFS, "trace_marker"), "qv:e2e:render:begin")
            time.sleep(0.01)
            write_marker(os.path.join(TRACEFS, "trace_marker"), "qv:e2e:render:end")

        self.assertTrue(c.stop(601))
        with open(self.results_path()) as f:
            results = json.load(f)
        self.assertEqual(results["name"], "QVReporting")
        self.assertEqual(results["version"], 4)
        decode = [v for v in results["values"] if v["name"] == "decode"]
        self.assertEqual(len(decode), 3, results)
        for value in decode:
            self.assertEqual(value["unit"], "milliseconds")
            self.assertGreaterEqual(value["value"], 30.0)
            self.assertLess(value["value"], 5000.0)
        render = [v for v in results["values"] if v["name"] == "render"]
        self.assertEqual(len(render), 1 if copies_top_level else 0, results)
        self.assertEqual([v for v in results["values"] if v["name"] == "never"], [])
        self.assertEqual(glob.glob(ours), [], "the instance is removed")
        raw = glob.glob(os.path.join(self.daemon.state_dir, "logs", "Audio", "Traces", "raw",
                                     "*.trace"))
        self.assertEqual(len(raw), 1)
        with open(raw[0]) as f:
            self.assertTrue(f.readline().startswith(
                f"# qvreportd trace: instance={os.path.basename(instances[0])} template=2 "
                "clock=mono"))
        self.assertFalse(os.path.exists(os.path.join(os.path.dirname(self.results_path()),
                                                     "temp_gaugedata.gdj")))
        log = self.daemon.log_text()
        self.assertIn("Performance Trace Completed: " + raw[0], log)
        self.assertIn("unpairedBegins=0 unmatchedEnds=1", log)


class TraceWithoutTracefs(TraceSessionCase):
    # /proc is no tracefs: the recorder fails at start and the session goes on without a trace.
    daemon_args = ("--internal-build", "--tracefs", "/proc")

    def test_a_test_session_without_tracefs_logs_the_failure_and_writes_nothing(self):
        c = self.start_test_session(602)
        # Were the worker to wait out its 180-second time-out, this call's reply would time out.
        self.assertTrue(c.stop(602))
        log = self.daemon.log_text()
        self.assertIn("spanTraceDidStart /proc is not a mounted tracefs", log)
        self.assertIn("No traceResults at path: (null)", log)
        self.assertFalse(os.path.exists(self.results_path()))
        self.assertEqual(list(c.reporting.GetAllReporters()), [602])


if __name__ == "__main__":
    unittest.main()

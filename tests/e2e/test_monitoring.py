"""Driver statistics and memory listings of the real daemon: counters read from a laptop's
counter files under --sysfs-root, memory listings run through the shell."""

import json
import os
import re
import shutil
import subprocess
import sys
import tempfile
import unittest

sys.path.insert(0, os.path.dirname(__file__))
from harness import DAEMON, DaemonTestCase, wait_until  # noqa: E402

TEST_SERVICE, GENERIC, MEMORY_LOG = 11, 1, 19
FIXTURE_TOOL = os.environ.get(
    "QV_SYSFS_FIXTURE", os.path.join(os.path.dirname(DAEMON), "tests", "qv_sysfs_fixture"))


class DriverStatistics(DaemonTestCase):
    def setUp(self):
        self.sysfs = tempfile.mkdtemp(prefix="qv-sysfs-")
        self.addCleanup(shutil.rmtree, self.sysfs, True)
        subprocess.run([FIXTURE_TOOL, self.sysfs], check=True)
        self.daemon_args = ("--sysfs-root", self.sysfs)
        super().setUp()

    def write(self, relative, text):
        with open(os.path.join(self.sysfs, relative), "w") as f:
            f.write(text)

    def move_counters(self):
        self.write("sys/class/net/wlp0s20f3/statistics/rx_bytes", str(1000 + 2 * 17 + 1500))
        self.write("sys/class/net/enp0s31f6/statistics/tx_bytes", "3")  # reset: not reported
        self.write("sys/devices/system/cpu/cpu0/cpuidle/state2/time", str(3000000 + 500000))
        self.write("sys/devices/system/cpu/cpu0/cpuidle/state2/usage", str(300 + 7))
        self.write("sys/devices/system/cpu/cpufreq/policy1/stats/time_in_state",
                   "400000 100\n800000 200\n1200000 350\n1600000 0\n2000000 0\n2400000 50\n"
                   "2800000 10\n3200000 20\n")
        status = os.path.join(self.sysfs, "proc/asound/card0/pcm0p/sub0/status")
        with open(status) as f:
            text = f.read()
        self.write(status, re.sub(r"hw_ptr      : \d+", "hw_ptr      : 144000", text))
        with open(os.path.join(self.sysfs, "proc/interrupts")) as f:
            lines = f.read().split("\n")
        lines = [re.sub(r"\b500\b", "510", l) if l.lstrip().startswith("147:") else l
                 for l in lines]
        self.write("proc/interrupts", "\n".join(lines))

    def test_a_session_reports_the_counters_that_moved_between_its_start_and_stop(self):
        c = self.client()
        c.create(700, service_type=TEST_SERVICE)
        c.start(700)
        c.reporting.GetAllReporters()  # the start (and its snapshot) has run on the queue
        self.move_counters()
        self.assertTrue(c.stop(700))

        wait_until(lambda: self.daemon.events("com.korvane.test.ChannelStats.State"),
                   timeout=30, what="the ChannelStats messages")
        stats = [e for e in self.daemon.events("com.korvane.qvsound.ChannelStats.")]
        self.assertEqual([e["event"].rsplit(".", 1)[1] for e in stats],
                         ["Simple", "Histogram", "State"])
        simple, histogram, state = (e["payload"] for e in stats)
        self.assertEqual(simple["wlp0s20f3_Rx_Simple_rxbytes"], 1500)
        self.assertEqual(simple["PCH_Tx_IOAudio2_Simple_pcm0psub0frames"], 48000)
        self.assertEqual(simple["PCH_Tx_IOAudio2_Simple_pcm0psub0ms"], 1000)
        self.assertEqual(simple["sndhdaintel:card0_irq_MCA_Simple_irq147"], 40)
        self.assertNotIn("enp0s31f6_Tx_Simple_txbytes", simple)
        self.assertEqual(simple["audiotag"], "ChannelStatsSimple")
        self.assertEqual(
            histogram["intelcpufreq_StateTransitionTimesms_cpufreq_Histogram_policy1"],
            "count=8,lower=0,upper=3200000,min=400000,max=3200000,unit=kHz::"
            "1200000-1200000:500;3200000-3200000:200")
        # Duty cycles depend on the time that really passed.
        self.assertRegex(state["intelidle_StateTransitionTimesms_cpuidle_State_cpu0"],
                         r"^name:C2_ACPI,transition:7,residency:500,duty_cycle:\d\.\d{6};$")
        log = self.daemon.log_text()
        self.assertIn("couldn't find any channels for driver group KorvaneAE2MCA-(null)", log)
        self.assertIn("subscribed to group group pdm-(null)", log)

        # A second session without changes gets no statistics, though the interrupts are gone
        # by its stop; a third, after which one counter moved, gets that one alone. The sink
        # keeps the order of sending, so the third's message shows that the second sent none.
        for rid in (701, 702):
            c.create(rid, service_type=TEST_SERVICE)
            c.start(rid)
            c.reporting.GetAllReporters()
            if rid == 701:
                os.remove(os.path.join(self.sysfs, "proc/interrupts"))
            else:
                self.write("sys/class/net/lo/statistics/rx_packets", str(1000 + 13 * 17 + 1))
            self.assertTrue(c.stop(rid))
        simple = wait_until(lambda: self.daemon.events("com.korvane.qvsound.ChannelStats.Simple")
                            [1:], timeout=30, what="the third session's statistics")
        self.assertEqual({k: v for k, v in simple[0]["payload"].items() if "_Simple_" in k},
                         {"lo_Rx_Simple_rxpackets": 1})
        self.assertEqual(len(self.daemon.events("com.korvane.qvsound.ChannelStats.")), 4)
        self.assertIn("StatFeedCreateSamples error 2", self.daemon.log_text())


class MemoryLog(DaemonTestCase):
    def setUp(self):
        super().setUp()
        settings = {"MemoryLogProcessCommand": "printf ' 1 phys_mem 5\\nnoise\\n'",
                    "MemoryLogKernelCommand": "/nonexistent/kzone -l",
                    "MemoryLogTimeoutSeconds": 2}
        defaults = os.path.join(self.daemon.state_dir, "defaults")
        os.makedirs(defaults, exist_ok=True)
        with open(os.path.join(defaults, "com.korvane.qvsound.qvreporting.json"), "w") as f:
            json.dump(settings, f)

    def test_a_memory_request_of_a_test_session_is_listed_in_blocks_once(self):
        c = self.client()
        c.create(800, service_type=TEST_SERVICE)
        c.start(800)
        c.send({"reason": "e2e"}, GENERIC, MEMORY_LOG, [800])
        c.send({"reason": "again"}, GENERIC, MEMORY_LOG, [800])  # within 5 seconds: dropped
        c.reporting.GetAllReporters()  # both handled
        log = self.daemon.log_text()
        # The filtered listing, alone in its block (the log adds the last line feed).
        self.assertEqual(re.findall(r"WIRED LOG BLOCK \d+\n[^:]*\n", log),
                         ["WIRED LOG BLOCK 1\n 1 phys_mem 5\n\n"], log)
        self.assertIn("wiredlog: unable to execute '/nonexistent/kzone -l'", log)
        self.assertEqual(log.count("wiredlog: requesting "), 2)
        self.assertTrue(c.stop(800))


if __name__ == "__main__":
    unittest.main()

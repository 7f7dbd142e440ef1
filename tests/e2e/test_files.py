"""What qvreportd keeps on disk: sink segments within their budget, read back across segments by
qvreportctl, and files that are not what they should be (a pipe where a sink file belongs, a
directory, a device or a pipe as the device file, a file size limit), which the daemon refuses,
counts and survives."""

import json
import os
import re
import resource
import shutil
import signal
import subprocess
import sys
import tempfile
import time
import unittest

sys.path.insert(0, os.path.dirname(__file__))
from harness import DAEMON, Bus, Client, Daemon, DaemonTestCase, wait_until  # noqa: E402

CTL = os.path.join(os.path.dirname(os.path.abspath(DAEMON)), "qvreportctl")
PLAYBACK, START = 4, 1
# Generous: the machine may be busy with other builds.
WAIT = 30.0
# The file size limit of one case (ulimit -f, LimitFSIZE=).
LIMIT = 256 * 1024


def send_messages(client, rid, count, size):
    client.create(rid, service_type=2)
    client.start(rid)
    for i in range(count):
        client.send({"i": i, "pad": "p" * size}, PLAYBACK, START, [rid])
    client.stop(rid)


class SegmentsAndBudgets(DaemonTestCase):
    daemon_args = ("--sink-segment-bytes", "4096", "--sinks-max-bytes", "65536")

    def setUp(self):
        super().setUp()
        # Convo off: with it, its closed segments (the summary at the stop alone holds every
        # value sent) shared the budget with the analytics sink's, and which sink kept any
        # depended on which sink's thread ran ahead.
        defaults = os.path.join(self.daemon.state_dir, "defaults")
        os.makedirs(defaults, exist_ok=True)
        with open(os.path.join(defaults, "com.korvane.qvsound.convo.json"), "w") as f:
            json.dump({"Enabled": False}, f)

    def test_closed_segments_stay_within_the_budget_and_read_back_in_seq_order(self):
        c = self.client()
        send_messages(c, 7, 600, 50)
        sinks = os.path.join(self.daemon.state_dir, "sinks")
        stats = wait_until(lambda: (lambda s: s if s.get("sink_bytes_expired_analytics", 0) > 0
                                    else None)(c.stats.GetStats()),
                           timeout=WAIT, what="segments expired")
        self.assertEqual(self.daemon.stop(), 0)

        closed = [n for n in os.listdir(sinks) if n.startswith("analytics.") and n != "analytics.jsonl"]
        self.assertTrue(closed)
        for name in closed:
            self.assertRegex(name, r"^analytics\.\d{12}\.jsonl$")
        closed_bytes = sum(os.path.getsize(os.path.join(sinks, n)) for n in os.listdir(sinks)
                           if re.fullmatch(r"\w+\.\d{12}\.jsonl", n))
        self.assertLessEqual(closed_bytes, 65536)
        self.assertIn("sinks: removed the", self.daemon.log_text())

        out = subprocess.run([CTL, "--state-dir", self.daemon.state_dir, "--json", "sinks",
                              "analytics"], check=True, capture_output=True, text=True,
                             timeout=WAIT).stdout
        seqs = [json.loads(line)["seq"] for line in out.splitlines()]
        self.assertGreater(seqs[0], 1, "the oldest lines expired")
        self.assertEqual(seqs, list(range(seqs[0], seqs[0] + len(seqs))), "no gap after them")
        self.assertGreater(stats["sink_bytes_expired_analytics"], 0)

        # A restart goes on from the last seq.
        restarted = Daemon(self.bus, self.daemon.state_dir, *self.daemon_args)
        self.daemon = restarted
        send_messages(self.client(), 8, 1, 10)
        self.assertEqual(restarted.stop(), 0)
        after = [l["seq"] for l in restarted.sink_lines("analytics")]
        self.assertEqual(after[len(after) - 1], after[len(after) - 2] + 1)
        self.assertGreater(after[-1], seqs[-1])


class MisplacedFiles(unittest.TestCase):
    """Each case: a fresh state directory and daemon on one private bus; the daemon must own its
    name, serve, count what it refused and stop on SIGTERM with status 0."""

    def setUp(self):
        self.workdir = tempfile.mkdtemp(prefix="qv-e2e-files-")
        self.bus = Bus(self.workdir)

    def tearDown(self):
        self.bus.stop()
        shutil.rmtree(self.workdir, ignore_errors=True)

    def test_the_daemon_refuses_what_is_misplaced_says_so_counts_it_and_goes_on(self):
        def sink_fifo(state):
            os.makedirs(os.path.join(state, "sinks"))
            os.mkfifo(os.path.join(state, "sinks", "analytics.jsonl"))
            return (), os.path.join(state, "sinks", "analytics.jsonl") + ": it is a FIFO"

        def device_directory(state):
            path = os.path.join(state, "..", "device-dir")
            os.makedirs(path, exist_ok=True)
            return ("--device-file", path), path + ": it is a directory"

        def device_zero(state):
            return ("--device-file", "/dev/zero"), "/dev/zero: it is a character device"

        def device_fifo(state):
            path = os.path.join(state, "..", "device-fifo")
            if not os.path.exists(path):
                os.mkfifo(path)
            return ("--device-file", path), path + ": it is a FIFO"

        def file_size_limit(state):
            # The analytics sink starts just under the limit, so it passes it long before the
            # daemon's log (written under the same limit) does.
            os.makedirs(os.path.join(state, "sinks"))
            with open(os.path.join(state, "sinks", "analytics.jsonl"), "w") as f:
                line, now = 0, time.time()  # a young segment: not closed for its age
                while f.tell() < LIMIT - 4096:
                    line += 1
                    f.write(json.dumps({"time": now, "seq": line, "event": "e", "payload": {}},
                                       separators=(",", ":")) + "\n")
            return (), "analytics.jsonl: File too large"

        cases = [
            ("a FIFO as a sink file", sink_fifo, None, "files_refused"),
            ("a directory as the device file", device_directory, None, "files_refused"),
            ("/dev/zero as the device file", device_zero, None, "files_refused"),
            ("a FIFO as the device file", device_fifo, None, "files_refused"),
            ("a file size limit", file_size_limit,
             lambda: resource.setrlimit(resource.RLIMIT_FSIZE, (LIMIT, LIMIT)),
             "sink_lines_lost_analytics"),
        ]
        for what, prepare, limit, counter in cases:
            with self.subTest(what):
                state = os.path.join(self.workdir, what.replace(" ", "-").replace("/", ""))
                os.makedirs(state)
                args, said = prepare(state)
                daemon = Daemon(self.bus, state, *args, preexec_fn=limit, timeout=WAIT)
                try:
                    c = Client(self.bus)
                    send_messages(c, 1, 100, 1000)
                    stats = wait_until(lambda: (lambda s: s if s.get(counter, 0) > 0 else None)(
                        c.stats.GetStats()), timeout=WAIT, what=counter)
                    self.assertGreater(stats[counter], 0)
                    self.assertIsNone(daemon.process.poll(), "still running")
                    self.assertIn(said, daemon.log_text())
                finally:
                    if daemon.process.poll() is None:
                        daemon.process.send_signal(signal.SIGTERM)
                    status = daemon.process.wait(timeout=WAIT)
                    daemon.log.close()
                self.assertEqual(status, 0, daemon.log_text())


if __name__ == "__main__":
    unittest.main()

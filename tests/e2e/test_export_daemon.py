"""qvreport-export under the real daemon: qvreportd rotates its sink segments while the exporter
follows them, and its disk budget removes segments the stopped exporter had not sent yet (they
are counted as expired, and nothing else is lost)."""

import os
import shutil
import signal
import tempfile
import unittest

from harness import Bus, Daemon, Client, wait_until
from nats_harness import Exporter, NatsServer, StreamComparison, file_lines

DSP_PLAYBACK, STATE, TELEPHONY = 0x10000004, 18, 2
SMALL_SEGMENTS = ("--sink-segment-bytes", "8192")


class DaemonRotation(unittest.TestCase):
    def setUp(self):
        self.workdir = tempfile.mkdtemp(prefix="qvexport-daemon-")
        self.state = os.path.join(self.workdir, "state")
        os.makedirs(self.state)
        self.bus = Bus(self.workdir)
        self.server = NatsServer(self.workdir, "single")
        self.server.start()
        self.exporter = Exporter(self.workdir, self.state, self.server.url)
        self.daemon = None

    def tearDown(self):
        if self.daemon:
            self.daemon.stop()
        self.exporter.stop(signal.SIGKILL)
        self.server.stop()
        self.bus.stop()
        shutil.rmtree(self.workdir, ignore_errors=True)

    def sessions(self, first_rid, count, messages):
        client = Client(self.bus)
        for rid in range(first_rid, first_rid + count):
            client.create(rid, service_type=TELEPHONY,
                          config={"KXHostApplicationDisplayID": "com.example.call"})
            client.start(rid)
            for i in range(messages):
                client.send({"i": i, "rid": rid, "text": "x" * 100}, DSP_PLAYBACK, STATE, [rid])
            self.assertTrue(client.stop(rid))
        client.connection.close()

    def sinks(self):
        names = {n.split(".")[0] for n in os.listdir(os.path.join(self.state, "sinks"))
                 if n.endswith(".jsonl")}
        return {name: max(seq for seq, _ in file_lines(self.state, name)) for name in names}

    def test_rotation_under_the_exporter_then_expiry_before_sending(self):
        self.daemon = Daemon(self.bus, self.state, *SMALL_SEGMENTS)
        self.exporter.start()
        self.sessions(1, 4, 150)
        self.assertEqual(self.daemon.stop(), 0)
        self.daemon = None
        last = self.sinks()
        closed = [n for n in os.listdir(os.path.join(self.state, "sinks")) if n.count(".") == 2]
        self.assertGreater(len(closed), 10, "the daemon rotated its segments")
        self.exporter.wait_caught_up(last)
        StreamComparison(self.server.url, self.state, list(last)).check(self)

        # The exporter is down while the daemon writes more than its budget keeps.
        self.assertEqual(self.exporter.stop(), 0)
        cursor = self.exporter.cursor()
        self.daemon = Daemon(self.bus, self.state, *SMALL_SEGMENTS, "--sinks-max-bytes", "65536")
        self.sessions(10, 4, 150)
        self.assertEqual(self.daemon.stop(), 0)
        self.daemon = None
        last = self.sinks()
        expired = {}
        for sink, seq in last.items():
            on_disk = sum(1 for s, _ in file_lines(self.state, sink) if s > cursor.get(sink, 0))
            expired[sink] = seq - cursor.get(sink, 0) - on_disk
        self.assertGreater(sum(expired.values()), 0, "the budget removed unsent lines")

        self.exporter.start()
        self.exporter.wait_caught_up(last)
        lines = StreamComparison(self.server.url, self.state, list(last)).check(self)
        wait_until(lambda: all((self.exporter.status() or {}).get("sinks", {}).get(s, {}).get(
            "cursor") == seq for s, seq in last.items()), timeout=30, what="the status")
        status = self.exporter.status()["sinks"]
        self.assertEqual({s: status[s]["expired"] for s in last}, expired)
        print(f"\nfigures: daemon rotation: {lines} lines in the stream, "
              f"{sum(expired.values())} expired before sending ({expired})")


if __name__ == "__main__":
    unittest.main()

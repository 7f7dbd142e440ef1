"""qvreport-export against a real one-node nats-server on a loopback port: every sink line in the
stream exactly once and in seq order, following growth and rotation, the cursor, expired lines,
SIGKILL mid-batch, and `qvreportctl fleet` reading it all back."""

import hashlib
import hmac
import json
import os
import shutil
import signal
import subprocess
import tempfile
import unittest

from harness import wait_until
from nats_harness import (CTL, Exporter, NatsServer, SinkFiles, StreamComparison, ctl, nkey_pair,
                          stream_lines)

# The exporter's application ID (export/QVReportingExportDevice.cpp).
APP_ID = bytes.fromhex("7b78f25c0cd94ba0b2a0e1a1d1d75d74")


def app_specific_device():
    """What sd_id128_get_machine_app_specific gives for the exporter's application ID."""
    with open("/etc/machine-id") as f:
        machine = bytes.fromhex(f.read().strip())
    id_ = bytearray(hmac.new(machine, APP_ID, hashlib.sha256).digest()[:16])
    id_[6] = (id_[6] & 0x0F) | 0x40
    id_[8] = (id_[8] & 0x3F) | 0x80
    return id_.hex(), machine.hex()


class ExportTestCase(unittest.TestCase):
    def setUp(self):
        self.workdir = tempfile.mkdtemp(prefix="qvexport-")
        self.state = os.path.join(self.workdir, "state")
        self.exporters = []
        self.server = self.make_server()
        self.server.start()
        self.url = self.server.url

    def make_server(self):
        return NatsServer(self.workdir, "single")

    def tearDown(self):
        for exporter in self.exporters:
            exporter.stop(signal.SIGKILL)
        self.server.stop()
        shutil.rmtree(self.workdir, ignore_errors=True)

    def exporter(self, *extra, state=None, name="exporter"):
        exporter = Exporter(self.workdir, state or self.state, self.url, *extra, name=name)
        self.exporters.append(exporter)
        return exporter


class Everyday(ExportTestCase):
    def test_ships_follows_rotation_and_reads_back(self):
        analytics = SinkFiles(self.state, "analytics")
        convo = SinkFiles(self.state, "convo")
        analytics.append(500)
        analytics.rotate()
        analytics.append(300)
        convo.append(50)
        exporter = self.exporter().start()
        exporter.wait_caught_up({"analytics": 800, "convo": 50})

        # Growth, a rotation with the old current segment renamed under the reader, and a
        # line cut short (no line feed yet) that is sent only once it is whole.
        analytics.append(200)
        analytics.rotate()
        analytics.append(10)
        convo.append(5)
        with open(convo.current, "a") as f:
            f.write('{"time":1.5,"seq":56,"event":"e","pay')
        exporter.wait_caught_up({"analytics": 1010, "convo": 55})
        self.assertNotIn(56, [seq for (_, sink), lines in stream_lines(self.server.url).items()
                              if sink == "convo" for seq, _ in lines])
        with open(convo.current, "a") as f:
            f.write('load":{}}\n')
        convo.seq = 56
        exporter.wait_caught_up({"analytics": 1010, "convo": 56})

        comparison = StreamComparison(self.server.url, self.state, ["analytics", "convo"])
        self.assertEqual(comparison.check(self), 1066)
        device, machine = app_specific_device()
        self.assertEqual(comparison.devices, {device})
        self.assertNotEqual(device, machine)

        # The counters reach `fleet status`: everything sent once, acknowledged, no lag.
        def settled():
            status = exporter.status()
            return status if status and status["sinks"].get("analytics", {}).get(
                "cursor") == 1010 and status["sinks"].get("convo", {}).get("cursor") == 56 else None
        wait_until(settled, timeout=30, what="the status to show the cursor")
        status = json.loads(ctl("--state-dir", self.state, "--json", "fleet", "status"))
        for sink, count in (("analytics", 1010), ("convo", 56)):
            counters = status["sinks"][sink]
            self.assertEqual((counters["sent"], counters["acknowledged"], counters["duplicates"],
                              counters["retried"], counters["expired"], counters["lag_lines"]),
                             (count, count, 0, 0, 0, 0), sink)
        self.assertTrue(status["connected"])
        self.assertEqual(status["device"], device)
        text = ctl("--state-dir", self.state, "fleet", "status")
        self.assertRegex(text, r"analytics\s+1010\s+1010\s+0\s+0\s+0\s+0\s+1010\s+0")

        # Reading back: one sink, one device, another device, and the devices seen.
        only_convo = stream_lines(self.server.url, "--sink", "convo")
        self.assertEqual(list(only_convo), [(device, "convo")])
        self.assertEqual([seq for seq, _ in only_convo[(device, "convo")]], list(range(1, 57)))
        self.assertEqual(stream_lines(self.server.url, "--device", "0" * 32), {})
        human = ctl("fleet", "tail", "--nats-url", self.server.url, "--sink", "convo")
        self.assertRegex(human.splitlines()[0], rf"^{device} \d{{4}}-\d\d-\d\dT.*Z convo ")
        devices = [json.loads(line) for line in
                   ctl("--json", "fleet", "devices", "--nats-url", self.server.url).splitlines()]
        newest = max(obj["time"] for _, obj in comparison.by_sink["analytics"][1])
        self.assertEqual(len(devices), 1)
        self.assertEqual(devices[0]["device"], device)
        self.assertEqual(devices[0]["sinks"], {"analytics": 1010, "convo": 56})
        self.assertAlmostEqual(devices[0]["last_report"], newest, places=3)

        # A normal stop keeps the cursor; a restart sends nothing again.
        self.assertEqual(exporter.stop(), 0)
        self.assertEqual(exporter.cursor(), {"analytics": 1010, "convo": 56})
        exporter.start()
        analytics.append(1)
        exporter.wait_caught_up({"analytics": 1011})
        wait_until(lambda: (exporter.status() or {}).get("sinks", {}).get("analytics", {}).get(
            "cursor") == 1011, timeout=30, what="the status after the restart")
        self.assertEqual(exporter.status()["sinks"]["analytics"]["sent"], 1)
        self.assertEqual(exporter.status()["sinks"]["convo"]["sent"], 0)

    def test_cursor_and_expired_lines(self):
        analytics = SinkFiles(self.state, "analytics")
        analytics.append(100)
        # A cursor that cannot be read is never written over: starting from nothing would
        # resend every line on disk.
        os.makedirs(os.path.join(self.state, "export"))
        cursor_path = os.path.join(self.state, "export", "cursor.json")
        for garbage in ("{not json", '{"sinks": {"analytics": -3}}', "[]"):
            with open(cursor_path, "w") as f:
                f.write(garbage)
            exporter = self.exporter().start()
            exporter.proc.wait(timeout=30)
            self.assertEqual(exporter.proc.returncode, 1, garbage)
            self.assertIn("not starting", exporter.log())
            with open(cursor_path) as f:
                self.assertEqual(f.read(), garbage)
            exporter.proc = None

        # A cursor in the middle of the sink: only what follows is sent.
        with open(cursor_path, "w") as f:
            json.dump({"sinks": {"analytics": 40}}, f)
        analytics.rotate()
        analytics.append(100)   # 101..200
        analytics.rotate()
        analytics.append(100)   # 201..300
        analytics.rotate()
        analytics.append(10)    # 301..310
        # The disk budget takes the two oldest segments before the exporter reads them: seq
        # 41..100 were never sent, 1..40 had been.
        first = analytics.expire_oldest()
        second = analytics.expire_oldest()
        self.assertEqual((first, second), (100, 100))
        exporter = self.exporter().start()
        exporter.wait_caught_up({"analytics": 310})
        in_stream = stream_lines(self.server.url)
        seqs = [seq for lines in in_stream.values() for seq, _ in lines]
        self.assertEqual(seqs, list(range(201, 311)))
        wait_until(lambda: (exporter.status() or {}).get("sinks", {}).get("analytics", {}).get(
            "cursor") == 310, timeout=30, what="the status")
        counters = exporter.status()["sinks"]["analytics"]
        self.assertEqual((counters["expired"], counters["sent"]), (160, 110))
        self.assertIn("160 lines expired before they were sent (seq 41 to 200)", exporter.log())
        StreamComparison(self.server.url, self.state, ["analytics"]).check(self)


class Security(ExportTestCase):
    """TLS through the URL and an nkey file, against a server that requires both."""

    def make_server(self):
        cert, key = (os.path.join(self.workdir, n) for n in ("cert.pem", "key.pem"))
        subprocess.run(["openssl", "req", "-x509", "-newkey", "ec", "-pkeyopt",
                        "ec_paramgen_curve:prime256v1", "-nodes", "-keyout", key, "-out", cert,
                        "-days", "1", "-subj", "/CN=127.0.0.1",
                        "-addext", "subjectAltName=IP:127.0.0.1"],
                       check=True, capture_output=True)
        self.cert = cert
        public, seed = nkey_pair()
        self.nkey = os.path.join(self.workdir, "user.nk")
        with open(self.nkey, "w") as f:
            f.write(f"{public}\n{seed}\n")
        stranger_public, stranger_seed = nkey_pair()
        self.stranger = os.path.join(self.workdir, "stranger.nk")
        with open(self.stranger, "w") as f:
            f.write(f"{stranger_public}\n{stranger_seed}\n")
        return NatsServer(
            self.workdir, "secure",
            extra_config=(f'tls {{ cert_file: "{cert}", key_file: "{key}" }}\n'
                          f"authorization {{ users = [ {{ nkey: {public} }} ] }}\n"))

    def setUp(self):
        super().setUp()
        self.url = f"tls://127.0.0.1:{self.server.port}"

    def test_tls_and_nkey(self):
        SinkFiles(self.state, "analytics").append(20)
        self.exporter("--tls-ca", self.cert, "--nkey", self.nkey).start().wait_caught_up(
            {"analytics": 20})
        secure = ("--tls-ca", self.cert, "--nkey", self.nkey)
        lines = stream_lines(self.url, *secure)
        self.assertEqual([seq for _, lines in lines.items() for seq, _ in lines], list(range(1, 21)))

        # Without the key, without TLS, with a key the server does not know: refused.
        for args in ((self.url, "--tls-ca", self.cert),
                     (f"nats://127.0.0.1:{self.server.port}", "--nkey", self.nkey),
                     (self.url, "--tls-ca", self.cert, "--nkey", self.stranger)):
            done = subprocess.run([CTL, "fleet", "tail", "--nats-url", *args],
                                  capture_output=True, text=True, timeout=60)
            self.assertEqual(done.returncode, 1, args)
            self.assertIn("cannot connect", done.stderr)
        stranger_state = os.path.join(self.workdir, "stranger-state")
        SinkFiles(stranger_state, "analytics").append(5)
        stranger = self.exporter("--tls-ca", self.cert, "--nkey", self.stranger,
                                 state=stranger_state, name="stranger").start()
        # Three seconds of trying (the right key connects within a few milliseconds).
        def tried_long_enough():
            status = stranger.status()
            return status if status and status["updated"] - status["started"] >= 3 else None
        self.assertFalse(wait_until(tried_long_enough, timeout=60, what="three seconds")["connected"])
        self.assertEqual(stranger.cursor().get("analytics", 0), 0)
        self.assertEqual(self.server.stream_messages("QVREPORTING"), 20)


class KillMidBatch(ExportTestCase):
    def test_sigkill_mid_batch_then_restart(self):
        analytics = SinkFiles(self.state, "analytics")
        mtx = SinkFiles(self.state, "energylog")
        analytics.append(40000)
        mtx.append(10000)
        exporter = self.exporter("--max-pending", "2000").start()
        # Killed while acknowledgements are in flight, most lines still to go.
        wait_until(lambda: self.server.stream_messages("QVREPORTING") >= 5000, timeout=60,
                   interval=0.01, what="lines in the stream")
        exporter.proc.send_signal(signal.SIGKILL)
        exporter.proc.wait()
        in_stream_at_kill = self.server.stream_messages("QVREPORTING")
        self.assertLess(in_stream_at_kill, 50000)
        killed_at = dict(exporter.cursor())
        exporter.proc = None
        exporter.start()
        exporter.wait_caught_up({"analytics": 40000, "energylog": 10000}, timeout=90)
        total = StreamComparison(self.server.url, self.state, ["analytics", "energylog"]).check(self)
        self.assertEqual(total, 50000)
        wait_until(lambda: (exporter.status() or {}).get("sinks", {}).get("analytics", {}).get(
            "cursor") == 40000, timeout=30, what="the status")
        status = exporter.status()["sinks"]
        duplicates = sum(s["duplicates"] for s in status.values())
        print(f"\nfigures: SIGKILL mid-batch: {total} lines, {in_stream_at_kill} in the stream "
              f"and cursor {killed_at} at the kill, "
              f"{duplicates} resent lines refused by the stream as duplicates")


if __name__ == "__main__":
    unittest.main()
